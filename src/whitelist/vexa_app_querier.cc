#include "whitelist/vexa_app_querier.h"

#include "assembly/fbf_strings.h"
#include "platform/logging.h"
#include "util/lock.h"

namespace fbf {
namespace {

spdlog::logger& querierLog() { return logging::get("VexaAppQuerier"); }

// Filled by the registry's reply; read by the asker only after the reply
// signalled, and only if it was still waiting.
struct EntitledQuery {
  ConditionLock<bool> answered{false};
  std::vector<std::string> identifiers;
};

}  // namespace

VexaAppQuerier::VexaAppQuerier(std::shared_ptr<UserDefaults> assistantDefaults,
                               std::shared_ptr<AssistantAppRegistry> extensions,
                               std::shared_ptr<const ApplicationRegistry> applications,
                               std::chrono::milliseconds wait)
    : assistantDefaults_(std::move(assistantDefaults)),
      extensions_(std::move(extensions)),
      applications_(std::move(applications)),
      wait_(wait) {}

std::optional<bool> VexaAppQuerier::assistantEnabled() const {
  if (!assistantDefaults_) return std::nullopt;
  return assistantDefaults_->boolForKey(FBFStrings::LinuxDefaults::AssistantEnabled);
}

std::set<std::string> VexaAppQuerier::getFirstPartyApps() const {
  std::set<std::string> result;
  for (const auto& app : applications_->installedApplications()) {
    if (app.bundleIdentifier.starts_with(kFirstPartyPrefix)) result.insert(app.bundleIdentifier);
  }
  return result;
}

std::vector<std::string> VexaAppQuerier::findEnabledVexaApps(
    const std::vector<std::string>& apps, const std::set<std::string>& manuallyDisabledApps) {
  if (assistantEnabled() != true) return {};

  auto query = std::make_shared<EntitledQuery>();
  query->identifiers = apps;
  extensions_->queryEntitledApplications([query](std::vector<std::optional<std::string>> entitled) {
    query->answered.lock();
    for (auto& id : entitled) {
      if (id) query->identifiers.push_back(std::move(*id));
    }
    query->answered.unlockWithValue(true);
  });

  double seconds = std::chrono::duration<double>(wait_).count();
  if (!query->answered.lockWhenValue(true, seconds)) {
    querierLog().error("query of assistant-entitled applications timed out after {} seconds",
                       seconds);
    return {};
  }
  std::set<std::string> result(query->identifiers.begin(), query->identifiers.end());
  query->answered.unlock();

  result.merge(getFirstPartyApps());
  for (const auto& disabled : manuallyDisabledApps) result.erase(disabled);
  return {result.begin(), result.end()};
}

}  // namespace fbf
