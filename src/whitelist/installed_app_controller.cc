#include "whitelist/installed_app_controller.h"

#include "assembly/fbf_assembly.h"
#include "assembly/fbf_strings.h"
#include "platform/logging.h"
#include "whitelist/desktop_entries.h"
#include "whitelist/whitelist_format.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace fbf {
namespace {

spdlog::logger& controllerLog() { return logging::get("InstalledAppController"); }

// Longest "soon" delay the test preference may ask for.
constexpr double kMaximumSoonDelaySeconds = 86400;

}  // namespace

InstalledAppController::InstalledAppController(FBFAssemblyProtocol& assembly,
                                               InstalledAppControllerDependencies deps)
    : assembly_(assembly), deps_(std::move(deps)) {
  if (!deps_.lowPriorityQueue || !deps_.transactions || !deps_.applications || !deps_.resources ||
      !deps_.vexaAppQuerier || !deps_.notifications) {
    FBF_FATAL("InstalledAppController is missing a dependency");
  }
  timer_ = deps_.lowPriorityQueue->makeTimer();
}

InstalledAppController::~InstalledAppController() {
  // On the queue, so that no timer handler or queued request runs after this.
  deps_.lowPriorityQueue->sync([this] {
    alive_.reset();
    timer_.reset();
    completionHandlers_.clear();
  });
}

void InstalledAppController::updateWhitelists(uint64_t condition,
                                              std::function<void()> completion) {
  switch (condition) {
    case static_cast<uint64_t>(FBFUpdateWhitelistCondition::now):
      controllerLog().debug("update whitelists now");
      break;
    case static_cast<uint64_t>(FBFUpdateWhitelistCondition::soon):
      controllerLog().debug("update whitelists soon");
      break;
    case static_cast<uint64_t>(FBFUpdateWhitelistCondition::ifStale):
      controllerLog().debug("update whitelists if stale");
      break;
    default:
      controllerLog().debug("update whitelists for reasons unknown");
      break;
  }

  if (condition == static_cast<uint64_t>(FBFUpdateWhitelistCondition::ifStale) && !isStale()) {
    controllerLog().debug("whitelist already up-to-date");
    if (completion) completion();
    return;
  }

  // Each request carries a transaction of its own until it has joined the
  // pending generation, so the process also stays alive for a request that
  // arrives while a generation is finishing and releasing the shared one.
  auto transaction = deps_.transactions->begin(std::string(FBFStrings::WhitelistTransactionName));
  auto delay = delayFor(condition);
  deps_.lowPriorityQueue->async([this, token = std::weak_ptr<int>(alive_),
                                 transaction = std::move(transaction),
                                 completion = std::move(completion), delay]() mutable {
    if (token.expired()) return;
    enqueue(std::move(transaction), std::move(completion), delay);
  });
}

bool InstalledAppController::isStale() {
  auto url = vexaKitFileURL();
  if (!url) return true;
  auto& fileManager = assembly_.fileManager();
  std::error_code error;
  auto attributes = fileManager.attributes(*url, &error);
  if (!attributes) {
    if (error == std::errc::no_such_file_or_directory) {
      std::error_code createError;
      FileDescriptor created;
      if (fileManager.createOrFixDirectory(url->parent_path(), createError)) {
        created = fileManager.createForWriting(*url, createError);
      }
      if (!created.valid()) {
        controllerLog().error("could not write whitelist file {}",
                              fmt::format("{}: {}", url->string(), createError.message()));
      }
      return true;
    }
    controllerLog().error("could not get modify time");
    return true;
  }
  if (!attributes->isRegular()) {
    controllerLog().error("could not get modify time");
    return true;
  }
  SystemTime now = assembly_.currentDate();
  if (attributes->modificationDate > now - kStalenessInterval) return false;
  if (!fileManager.setModificationDate(*url, now, error)) {
    controllerLog().error("could not set modify time of {}: {}", url->string(), error.message());
  }
  return true;
}

std::chrono::steady_clock::duration InstalledAppController::delayFor(uint64_t condition) const {
  if (condition != static_cast<uint64_t>(FBFUpdateWhitelistCondition::soon)) return kPromptDelay;
  auto configured =
      assembly_.userDefaults().objectForKey(FBFStrings::LinuxDefaults::WhitelistSoonDelaySeconds);
  if (configured && configured->is_number()) {
    double seconds = configured->get<double>();
    if (seconds >= 0 && seconds <= kMaximumSoonDelaySeconds) {
      return std::chrono::duration_cast<std::chrono::steady_clock::duration>(
          std::chrono::duration<double>(seconds));
    }
  }
  return kSoonDelay;
}

void InstalledAppController::enqueue(std::shared_ptr<Transaction> transaction,
                                     std::function<void()> completion,
                                     std::chrono::steady_clock::duration delay) {
  transaction_.compareAndSwap(nullptr, [&] { return std::move(transaction); });
  if (completion) completionHandlers_.push_back(std::move(completion));
  timer_->schedule(delay, [this, token = std::weak_ptr<int>(alive_)] {
    if (token.expired()) return;
    generate();
  });
}

void InstalledAppController::generate() {
  generatingWhitelist_.store(true);
  auto manuallyDisabledApps = getManuallyDisabledApps(assembly_.preferences());
  generateWhitelistSignature(manuallyDisabledApps);
  generateVexaKitAppList({std::string(VexaNonAppSuggestionBundleId)}, manuallyDisabledApps);
  auto handlers = std::move(completionHandlers_);
  completionHandlers_.clear();
  for (auto& handler : handlers) handler();
  generatingWhitelist_.store(false);
  transaction_.store(nullptr);
}

int InstalledAppController::fileHandle(std::string_view resource) const {
  auto path = deps_.resources->pathToResource(resource);
  if (!path) {
    controllerLog().error("no file handle for {}: {}", resource, std::strerror(ENOENT));
    return -1;
  }
  // Non-blocking so that a FIFO planted in its place cannot stall the queue.
  int fd = open(path->c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (fd < 0) {
    controllerLog().error("no file handle for {}: {}", path->string(), std::strerror(errno));
    return -1;
  }
  struct stat st {};
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    controllerLog().error("no file handle for {}: {}", path->string(), "not a regular file");
    close(fd);
    return -1;
  }
  return fd;
}

void InstalledAppController::generateWhitelistSignature(
    const std::set<std::string>& manuallyDisabledApps) {
  if (!deps_.lowPriorityQueue->isCurrent())
    FBF_FATAL("whitelist generation off the low-priority queue");
  auto& defaults = assembly_.userDefaults();
  const auto key = FBFStrings::kVIRAppWhitelistSignatureKey;

  FileDescriptor fd(fileHandle(kWhitelistResource));
  if (!fd.valid()) {
    controllerLog().error("Could not obtain file handle for installed app whitelist");
    defaults.removeObject(key);
    return;
  }
  std::error_code mapError;
  auto mapped = mmapFileHandle(fd.get(), &mapError);
  if (!mapped) {
    controllerLog().error("mappedData is nil");
    defaults.removeObject(key);
    return;
  }

  WhitelistFailure failure = WhitelistFailure::unusableFile;
  auto signature =
      processWhitelist(mapped->bytes(), manuallyDisabledApps, *deps_.applications, &failure);
  if (signature) {
    controllerLog().debug("signature: {}", *signature);
    defaults.setObject(key, *signature);
  } else {
    if (failure == WhitelistFailure::unusableFile) {
      controllerLog().error("installed app whitelist {} is malformed", kWhitelistResource);
    } else {
      controllerLog().debug("no installed application is whitelisted");
    }
    defaults.removeObject(key);
  }
  controllerLog().debug("updated signature user default");
}

void InstalledAppController::generateVexaKitAppList(
    const std::vector<std::string>& apps, const std::set<std::string>& manuallyDisabledApps) {
  if (!deps_.lowPriorityQueue->isCurrent())
    FBF_FATAL("assistant list generation off the low-priority queue");
  cacheVexaKitAppsList(deps_.vexaAppQuerier->findEnabledVexaApps(apps, manuallyDisabledApps));
}

std::optional<std::filesystem::path> InstalledAppController::vexaKitFileURL() const {
  auto caches = assembly_.fileManager().cachesDirectory();
  if (!caches) return std::nullopt;
  return *caches / std::string(FBFStrings::VireondReverseDomainIdentifier) /
         std::string(kVexaKitFileName);
}

void InstalledAppController::cacheVexaKitAppsList(const std::vector<std::string>& apps) {
  auto url = vexaKitFileURL();
  if (!url) {
    controllerLog().error("could not write whitelist file");
    return;
  }
  std::vector<std::string> sorted = apps;
  std::sort(sorted.begin(), sorted.end());
  std::string json = nlohmann::json(sorted).dump();

  auto& fileManager = assembly_.fileManager();
  std::error_code error;
  if (!fileManager.createOrFixDirectory(url->parent_path(), error) ||
      !fileManager.writeFileAtomically(*url, json, error)) {
    controllerLog().error("could not write whitelist file {}",
                          fmt::format("{}: {}", url->string(), error.message()));
    return;
  }
  controllerLog().debug("updated whitelist file");
  deps_.notifications->post(FBFStrings::SKAppDataChangedNotification);
}

std::unique_ptr<InstalledAppControllerProtocol> makeInstalledAppController(
    FBFAssembly& assembly, const XdgDirectories& dirs) {
  auto applications = std::make_shared<DesktopEntryRegistry>(applicationDirectories(dirs));
  auto assistantDefaults = assembly.preferences().defaultsForDomain(
      std::string(FBFStrings::LinuxDefaults::AssistantDomain));

  InstalledAppControllerDependencies deps;
  deps.lowPriorityQueue = makeSerialQueue(std::string(FBFStrings::LowPriorityQueueLabel));
  deps.transactions = &assembly.transactions();
  deps.applications = applications;
  deps.resources = std::make_shared<XdgDataResourceLocator>(dirs);
  deps.vexaAppQuerier = std::make_shared<VexaAppQuerier>(
      std::move(assistantDefaults), makeDesktopEntryAssistantRegistry(applications), applications);
  deps.notifications = makeSessionBusNotificationPoster();
  return std::make_unique<InstalledAppController>(assembly, std::move(deps));
}

}  // namespace fbf
