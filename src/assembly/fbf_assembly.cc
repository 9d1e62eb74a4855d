#include "assembly/fbf_assembly.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "platform/logging.h"
#include "util/lock.h"

namespace fbf {

namespace {
spdlog::logger& log() { return logging::get("FBFAssembly"); }
}  // namespace

FBFAssembly::FBFAssembly(FBFAssemblyDependencies deps) : deps_(std::move(deps)) {
  if (!deps_.preferences || !deps_.fileManager || !deps_.clock || !deps_.analytics || !deps_.transactions ||
      !deps_.deviceContext) {
    FBF_FATAL("FBFAssembly is missing a required collaborator");
  }
  workloop_ = deps_.workloop ? deps_.workloop
                             : std::shared_ptr<TaskQueue>(makeSerialQueue(std::string(FBFStrings::WorkloopLabel)));
  userDefaults_ = deps_.preferences->defaultsForDomain(std::string(FBFStrings::VireondReverseDomainIdentifier));
}

FBFAssembly::~FBFAssembly() = default;

std::optional<ConfigurationBag> FBFAssembly::cachedBag() {
  auto url = cachedBagURL(fileManager());
  if (!url) return std::nullopt;
  return bagCache_.read(*url, fileManager());
}

InstalledAppControllerProtocol* FBFAssembly::installedAppController() {
  if (!installedAppController_ && deps_.installedAppControllerFactory) {
    installedAppController_ = deps_.installedAppControllerFactory(*this);
  }
  return installedAppController_.get();
}

bool FBFAssembly::keepAliveAfterFlushing() { return userDefaults_->boolForKey(FBFStrings::Defaults::NoExitPostFlush); }

bool FBFAssembly::shouldProceed() {
  if (!workloop_->isCurrent()) FBF_FATAL("shouldProceed must be called on the work queue");
  if (uploadListener_) return true;
  if (cohortsListener_) return true;
  return !isCancelled();
}

bool FBFAssembly::isDiagnosticsAndUsageEnabled() {
  auto consent = deps_.preferences->defaultsForDomain(std::string(FBFStrings::LinuxDefaults::ConsentDomain));
  return consent->boolForKey(FBFStrings::LinuxDefaults::DiagnosticsAndUsageEnabled);
}

std::shared_ptr<ConduitActivity> FBFAssembly::conduitActivity() {
  std::shared_ptr<ConduitActivity> out;
  workloop_->sync([&] { out = conduitActivity_; });
  return out;
}

void FBFAssembly::setConduitActivity(std::shared_ptr<ConduitActivity> activity) {
  workloop_->async([this, activity = std::move(activity)]() mutable { conduitActivity_ = std::move(activity); });
}

std::shared_ptr<HttpClientSession> FBFAssembly::makeUploadSession() {
  if (!deps_.httpSessionFactory) return nullptr;
  HttpSessionConfiguration config;
  config.delegateQueue = workloop_;
  // Over HTTP/1.1 a few connections let uploads overlap a slow server's
  // replies; over HTTP/2 they are streams of one connection instead.
  config.maxConnectionsPerHost = kUploadConnectionsPerHost;
  config.pinnedPublicKeys = userDefaults_->stringForKey(FBFStrings::LinuxDefaults::UploadPinnedPublicKeys);
  if (auto ca = userDefaults_->stringForKey(FBFStrings::LinuxDefaults::UploadCAFile)) config.caFile = *ca;
  config.onInvalidated = [this] { uploadSessionDidBecomeInvalid(); };
  auto session = deps_.httpSessionFactory(std::move(config));
  if (!session) return session;
  didMakeUploadSession();
  bool cancelNow = false;
  {
    std::lock_guard lock(sessionsMutex_);
    std::erase_if(sessions_, [](const auto& weak) { return weak.expired(); });
    sessions_.push_back(session);
    cancelNow = isTerminating();
  }
  if (cancelNow) session->cancelAllTasks();
  return session;
}

void FBFAssembly::setTerminating() {
  terminating_.store(true);
  cancelled_.store(true);
  std::vector<std::shared_ptr<HttpClientSession>> live;
  {
    std::lock_guard lock(sessionsMutex_);
    for (auto& weak : sessions_) {
      if (auto s = weak.lock()) live.push_back(std::move(s));
    }
  }
  for (auto& s : live) s->cancelAllTasks();
}

void FBFAssembly::didMakeUploadSession() {
  auto transaction = deps_.transactions->begin(std::string(FBFStrings::UploadSessionTransactionName));
  workloop_->async([this, transaction = std::move(transaction)]() mutable {
    openTransactions_.push_back(std::move(transaction));
  });
}

void FBFAssembly::uploadSessionDidBecomeInvalid() {
  workloop_->async([this] {
    if (!openTransactions_.empty()) openTransactions_.pop_back();
  });
}

void FBFAssembly::didDeleteFeedbackFile(const FeedbackDeletionEvent& event) {
  deps_.analytics->sendEvent(FBFStrings::FeedbackLossEventName, [event]() -> std::optional<nlohmann::json> {
    auto payload = nlohmann::json::parse(event.toJSON().dump(), nullptr, false);
    if (payload.is_discarded() || !payload.is_object()) return std::nullopt;
    return payload;
  });
  if (deps_.lossLedger) deps_.lossLedger->record(event, currentDate());
  log().debug("Reported deletion of feedback type {} reason {}", event.feedbackType, event.reason);
}

std::vector<FeedbackLossCount> FBFAssembly::feedbackLossesSince(SystemTime since) {
  return deps_.lossLedger ? deps_.lossLedger->countsSince(since) : std::vector<FeedbackLossCount>{};
}

}  // namespace fbf
