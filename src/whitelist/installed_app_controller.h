// Keeps the installed-app whitelist signature (preference
// "VIRAppWhitelistSignature", domain "vireond") and the assistant app list
// (<caches>/vireond/assistant-apps.json) in step with the installed
// applications.
//
// Requests (`updateWhitelists`) may come from any thread. They are coalesced
// by one timer on the low-priority serial queue: every request re-arms it
// (60 s for "soon", 5 ms otherwise), and when it fires one generation runs
// and then calls every waiting completion, in arrival order, on that queue.
// An OS transaction is held from a request until the generation that serves
// it has finished.
//
// Owned by the composition root, which outlives it. Destroying the
// controller waits for a running generation and drops pending ones.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "platform/task_queue.h"
#include "platform/transactions.h"
#include "platform/xdg.h"
#include "util/atomic.h"
#include "util/lock.h"
#include "whitelist/application_registry.h"
#include "whitelist/notification_poster.h"
#include "whitelist/resource_locator.h"
#include "whitelist/vexa_app_querier.h"

#include <chrono>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace fbf {

class FBFAssembly;

// The update conditions clients send; any other value is served like "now".
enum class FBFUpdateWhitelistCondition : uint64_t { now = 0, soon = 1, ifStale = 2 };

struct InstalledAppControllerDependencies {
  // A serial queue of its own ("vireon-fbf.lowPriority").
  std::shared_ptr<TaskQueue> lowPriorityQueue;
  // Outlives the controller.
  TransactionRegistry* transactions = nullptr;
  std::shared_ptr<const ApplicationRegistry> applications;
  std::shared_ptr<const ResourceLocator> resources;
  std::shared_ptr<VexaAppQuerierProtocol> vexaAppQuerier;
  std::shared_ptr<NotificationPoster> notifications;
};

class InstalledAppController final : public InstalledAppControllerProtocol {
 public:
  static constexpr std::string_view kWhitelistResource = "vireond/app-whitelist.json";
  static constexpr std::string_view kVexaKitFileName = "assistant-apps.json";
  // Stands for assistant suggestions that are not applications.
  static constexpr std::string_view VexaNonAppSuggestionBundleId = "vireon.vexa.nonAppSuggestion";
  static constexpr std::chrono::seconds kSoonDelay{60};
  static constexpr std::chrono::milliseconds kPromptDelay{5};
  static constexpr std::chrono::hours kStalenessInterval{48};

  // `assembly` gives the "vireond" defaults, the preferences, the file manager
  // and "now"; it must outlive the controller.
  InstalledAppController(FBFAssemblyProtocol& assembly, InstalledAppControllerDependencies deps);
  ~InstalledAppController() override;

  void updateWhitelists(uint64_t condition, std::function<void()> completion) override;

  // <caches>/vireond/assistant-apps.json; no value without a caches directory.
  std::optional<std::filesystem::path> vexaKitFileURL() const;
  // True while a generation runs.
  bool isGeneratingWhitelist() const { return generatingWhitelist_.load(); }

 private:
  // False when the "if stale" check finds the list fresh.
  bool isStale();
  std::chrono::steady_clock::duration delayFor(uint64_t condition) const;
  void enqueue(std::shared_ptr<Transaction> transaction, std::function<void()> completion,
               std::chrono::steady_clock::duration delay);
  void generate();
  void generateWhitelistSignature(const std::set<std::string>& manuallyDisabledApps);
  void generateVexaKitAppList(const std::vector<std::string>& apps,
                              const std::set<std::string>& manuallyDisabledApps);
  void cacheVexaKitAppsList(const std::vector<std::string>& apps);
  int fileHandle(std::string_view resource) const;

  FBFAssemblyProtocol& assembly_;
  InstalledAppControllerDependencies deps_;
  // Low-priority queue only.
  std::unique_ptr<Timer> timer_;
  std::vector<std::function<void()>> completionHandlers_;
  // Reset on the queue at destruction; queued work that finds it gone does nothing.
  std::shared_ptr<int> alive_ = std::make_shared<int>(0);
  AtomicValue<std::shared_ptr<Transaction>> transaction_;
  Atomic<bool> generatingWhitelist_{false};
};

// The daemon's controller: desktop-entry registry and assistant query, the
// whitelist resource from the XDG data directories, notifications on the
// session bus, its own "vireon-fbf.lowPriority" queue and the assembly's
// transactions.
std::unique_ptr<InstalledAppControllerProtocol> makeInstalledAppController(
    FBFAssembly& assembly, const XdgDirectories& dirs);

}  // namespace fbf
