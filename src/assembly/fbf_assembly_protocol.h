// What every component receives from the composition root.
//
// All members except the atomic flags, `keepAliveAfterFlushing` and the
// computed members are used only on `workloop()`.
#pragma once

#include "assembly/configuration_bag.h"
#include "assembly/feedback_deletion_event.h"
#include "assembly/feedback_loss_ledger.h"
#include "platform/clock.h"
#include "platform/file_manager.h"
#include "platform/http_session.h"
#include "platform/task_queue.h"
#include "platform/user_defaults.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace fbf {

// Device and locale facts sent with uploads.
class DeviceContextProtocol {
 public:
  virtual ~DeviceContextProtocol() = default;
  virtual std::optional<std::string> localeIdentifier() const = 0;
  virtual std::optional<std::string> country() const = 0;
  virtual std::optional<std::string> deviceModel() const = 0;
  virtual std::optional<std::string> osVersion() const = 0;
  // "vireond/1.0 (<device string>) <daemon name and version>".
  virtual std::string userAgent() const = 0;
};

// A connected client that subscribed to uploads or cohort feedback.
class ClientConduit {
 public:
  virtual ~ClientConduit() = default;
  virtual void willUploadData(const std::string& data, const std::string& format) = 0;
  virtual void willGenerateCohortFeebacks(const std::string& data) = 0;
};

// Maintains the installed-app whitelist.
class InstalledAppControllerProtocol {
 public:
  virtual ~InstalledAppControllerProtocol() = default;
  // condition: 0 now, 1 soon, 2 if stale.
  virtual void updateWhitelists(uint64_t condition, std::function<void()> completion) = 0;
};

// The running periodic activity, asked whether to defer.
class ConduitActivity {
 public:
  virtual ~ConduitActivity() = default;
  virtual bool shouldDefer() const = 0;
};

class FBFAssemblyProtocol {
 public:
  virtual ~FBFAssemblyProtocol() = default;

  virtual TaskQueue& workloop() = 0;
  virtual UserDefaults& userDefaults() = 0;
  virtual PreferencesStore& preferences() = 0;
  virtual FileManager& fileManager() = 0;
  // Read anew from bag.plist on every call.
  virtual std::optional<ConfigurationBag> cachedBag() = 0;
  // Null when this build wires no controller.
  virtual InstalledAppControllerProtocol* installedAppController() = 0;
  virtual bool keepAliveAfterFlushing() = 0;

  virtual std::shared_ptr<ClientConduit> uploadListener() = 0;
  virtual void setUploadListener(std::shared_ptr<ClientConduit> listener) = 0;
  virtual std::shared_ptr<ClientConduit> cohortsListener() = 0;
  virtual void setCohortsListener(std::shared_ptr<ClientConduit> listener) = 0;

  // On the work queue: a listening client keeps work going after a cancel.
  virtual bool shouldProceed() = 0;
  virtual bool isCancelled() = 0;
  virtual void setCancelled(bool cancelled) = 0;
  // Set by a termination signal: cancels for the rest of the process, where
  // an offline cancellation only stops the flush it happened in.
  virtual bool isTerminating() { return false; }
  virtual void setTerminating() {}
  virtual bool isDiagnosticsAndUsageEnabled() = 0;
  virtual bool isFlushingEagerly() = 0;
  virtual void setFlushingEagerly(bool eager) = 0;
  virtual bool allowCellularUploads() = 0;
  virtual void setAllowCellularUploads(bool allow) = 0;

  virtual std::shared_ptr<ConduitActivity> conduitActivity() = 0;
  virtual void setConduitActivity(std::shared_ptr<ConduitActivity> activity) = 0;

  virtual const DeviceContextProtocol& deviceContext() = 0;
  // A new upload session that keeps the process alive until invalidated.
  virtual std::shared_ptr<HttpClientSession> makeUploadSession() = 0;
  virtual SystemTime currentDate() = 0;
  virtual void didDeleteFeedbackFile(const FeedbackDeletionEvent& event) = 0;
  // The deletion events at or after `since`, by type and reason; empty where
  // no ledger is kept.
  virtual std::vector<FeedbackLossCount> feedbackLossesSince(SystemTime since) {
    (void)since;
    return {};
  }
};

}  // namespace fbf
