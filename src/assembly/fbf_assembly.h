// The process's composition root: owns the platform handles, the work queue
// "vireon-fbf.workloop", the device context, the listener slots, the process
// flags and the open OS transactions, and hands them out through
// FBFAssemblyProtocol.
//
// Lives for the whole process. Listener slots, transactions and the activity
// are touched only on the work queue; the flags are atomic and may be set from
// any thread (signal handlers, IPC connections, the deferral timer).
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "platform/analytics.h"
#include "platform/transactions.h"
#include "util/atomic.h"

#include <mutex>
#include <vector>

namespace fbf {

class FBFAssembly;

struct FBFAssemblyDependencies {
  std::shared_ptr<PreferencesStore> preferences;
  std::shared_ptr<FileManager> fileManager;
  std::shared_ptr<const Clock> clock;
  std::shared_ptr<AnalyticsSink> analytics;
  std::shared_ptr<TransactionRegistry> transactions;
  std::shared_ptr<DeviceContextProtocol> deviceContext;
  // Optional: made on first use when absent.
  std::shared_ptr<TaskQueue> workloop;
  // Optional: where deletion events are kept for `fbfctl status`.
  std::shared_ptr<FeedbackLossLedger> lossLedger;
  // Optional: without it `makeUploadSession` returns null.
  HttpSessionFactory httpSessionFactory;
  // Optional: made lazily on the first `installedAppController()` call.
  std::function<std::unique_ptr<InstalledAppControllerProtocol>(FBFAssembly&)> installedAppControllerFactory;
};

class FBFAssembly final : public FBFAssemblyProtocol {
 public:
  static constexpr int kUploadConnectionsPerHost = 6;

  explicit FBFAssembly(FBFAssemblyDependencies deps);
  ~FBFAssembly() override;

  TaskQueue& workloop() override { return *workloop_; }
  std::shared_ptr<TaskQueue> sharedWorkloop() { return workloop_; }
  UserDefaults& userDefaults() override { return *userDefaults_; }
  PreferencesStore& preferences() override { return *deps_.preferences; }
  FileManager& fileManager() override { return *deps_.fileManager; }
  std::optional<ConfigurationBag> cachedBag() override;
  InstalledAppControllerProtocol* installedAppController() override;
  bool keepAliveAfterFlushing() override;

  std::shared_ptr<ClientConduit> uploadListener() override { return uploadListener_; }
  void setUploadListener(std::shared_ptr<ClientConduit> l) override { uploadListener_ = std::move(l); }
  std::shared_ptr<ClientConduit> cohortsListener() override { return cohortsListener_; }
  void setCohortsListener(std::shared_ptr<ClientConduit> l) override { cohortsListener_ = std::move(l); }

  bool shouldProceed() override;
  bool isCancelled() override { return cancelled_.load(); }
  void setCancelled(bool c) override { cancelled_.store(c); }
  bool isTerminating() override { return terminating_.load(); }
  // Also abandons every upload in flight: the process is about to stop, and
  // a stalled transfer must not hold it past the service manager's patience.
  // Their files stay for the next run.
  void setTerminating() override;
  bool isDiagnosticsAndUsageEnabled() override;
  bool isFlushingEagerly() override { return flushingEagerly_.load(); }
  void setFlushingEagerly(bool e) override { flushingEagerly_.store(e); }
  bool allowCellularUploads() override { return cellularUploads_.load(); }
  void setAllowCellularUploads(bool a) override { cellularUploads_.store(a); }

  std::shared_ptr<ConduitActivity> conduitActivity() override;
  void setConduitActivity(std::shared_ptr<ConduitActivity> activity) override;

  const DeviceContextProtocol& deviceContext() override { return *deps_.deviceContext; }
  std::shared_ptr<HttpClientSession> makeUploadSession() override;
  SystemTime currentDate() override { return deps_.clock->now(); }
  void didDeleteFeedbackFile(const FeedbackDeletionEvent& event) override;
  std::vector<FeedbackLossCount> feedbackLossesSince(SystemTime since) override;

  TransactionRegistry& transactions() { return *deps_.transactions; }
  const Clock& clock() const { return *deps_.clock; }
  // Work-queue only; for tests and `fbfctl status`.
  size_t openTransactionCount() const { return openTransactions_.size(); }

 private:
  void didMakeUploadSession();
  void uploadSessionDidBecomeInvalid();

  FBFAssemblyDependencies deps_;
  std::shared_ptr<TaskQueue> workloop_;
  std::shared_ptr<UserDefaults> userDefaults_;
  ConfigurationBagCache bagCache_;
  std::unique_ptr<InstalledAppControllerProtocol> installedAppController_;
  std::shared_ptr<ClientConduit> uploadListener_;
  std::shared_ptr<ClientConduit> cohortsListener_;
  std::shared_ptr<ConduitActivity> conduitActivity_;
  std::vector<std::shared_ptr<Transaction>> openTransactions_;
  std::mutex sessionsMutex_;
  std::vector<std::weak_ptr<HttpClientSession>> sessions_;  // guarded by sessionsMutex_
  Atomic<bool> flushingEagerly_{false};
  Atomic<bool> cellularUploads_{false};
  Atomic<bool> cancelled_{false};
  Atomic<bool> terminating_{false};
};

}  // namespace fbf
