#include "daemon/periodic_activity.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "platform/logging.h"
#include "util/lock.h"
#include "util/signpost.h"

#include <fstream>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("main"); }

std::string readTrimmed(const std::filesystem::path& p) {
  std::ifstream in(p);
  std::string s;
  std::getline(in, s);
  while (!s.empty() && std::isspace(static_cast<unsigned char>(s.back()))) s.pop_back();
  return s;
}

class SysfsPowerSource final : public PowerSource {
 public:
  explicit SysfsPowerSource(std::filesystem::path root) : root_(std::move(root)) {}
  // On battery: some mains supply exists and none is online, or a battery
  // reports that it discharges. No power-supply information means mains.
  bool onBattery() const override {
    std::error_code ec;
    bool sawMains = false, mainsOnline = false, discharging = false;
    for (const auto& entry : std::filesystem::directory_iterator(root_, ec)) {
      auto type = readTrimmed(entry.path() / "type");
      if (type == "Mains") {
        sawMains = true;
        mainsOnline |= readTrimmed(entry.path() / "online") == "1";
      } else if (type == "Battery") {
        discharging |= readTrimmed(entry.path() / "status") == "Discharging";
      }
    }
    if (sawMains) return !mainsOnline;
    return discharging;
  }

 private:
  std::filesystem::path root_;
};

}  // namespace

std::unique_ptr<PowerSource> makeSysfsPowerSource(std::filesystem::path root) {
  return std::make_unique<SysfsPowerSource>(std::move(root));
}

void overrideActivityFrequencyIfNecessary(FBFAssemblyProtocol& assembly, Activity& activity) {
  int64_t seconds = assembly.userDefaults().integerForKey(FBFStrings::Defaults::FlushFrequencyInSeconds);
  if (seconds < 1) return;
  ActivityCriteria c = activity.criteria();
  c.interval = std::chrono::seconds(seconds);
  c.allowBattery = true;
  c.requireScreenSleep = false;
  activity.setCriteria(c);
}

void doPeriodicConduitActivity(const std::shared_ptr<Activity>& activityPtr, FBFAssemblyProtocol& assembly,
                               const PeriodicActivityHooks& hooks) {
  Activity& activity = *activityPtr;
  overrideActivityFrequencyIfNecessary(assembly, activity);
  if (activity.state() != ActivityState::run) return;

  assembly.setConduitActivity(activityPtr);

  auto flush = [&] {
    if (!activity.setState(ActivityState::continueRunning)) {
      log().debug("Couldn't transition flusher activity to continue state, bailing on flush.");
      return;
    }
    if (assembly.userDefaults().boolForKey(FBFStrings::Defaults::DisableFlush)) {
      log().debug("FBF bailing because flushing is disabled. 'defaults delete vireond {}' to re-enable",
                  FBFStrings::Defaults::DisableFlush);
      return;
    }
    auto bag = cachedBagURL(assembly.fileManager());
    if (!bag || !assembly.fileManager().exists(*bag)) {
      log().debug("FBF bailing because we found no cached bag on disk.");
      return;
    }
    fbf_signpost_flushBegin();
    ConditionLock<int> finished(0);
    auto stop = hooks.beginFlush([&finished] {
      fbf_signpost_flushEnd();
      finished.lock();
      finished.unlockWithValue(1);
    });
    // First look now, then every second, until the flush reports its end.
    bool stopped = false;
    while (true) {
      if (!stopped && activity.shouldDefer()) {
        log().debug("Deferring flush.");
        if (stop) stop();
        stopped = true;
      }
      if (finished.lockWhenValue(1, 1.0)) {
        finished.unlock();
        break;
      }
    }
  };
  flush();

  // Finishing steps, also after every bail-out.
  assembly.setConduitActivity(nullptr);
  if (assembly.keepAliveAfterFlushing()) {
    log().debug("Respecting NoExit defaults flag and staying alive, staying alive.");
  } else {
    if (hooks.invalidateListener) hooks.invalidateListener();
    if (hooks.onMainQueueAfter) {
      auto exit = hooks.requestCleanExit;
      hooks.onMainQueueAfter(std::chrono::seconds(FBFConstants::ExitDelayAfterFlushSeconds), [exit] {
        log().debug("FBF: FBF's now finished.");
        if (exit) exit();
      });
    }
  }
  if (activity.setState(ActivityState::done)) {
    log().debug("Conduit activity done.");
  } else {
    log().debug("Couldn't transition flusher activity to done state.");
  }
}

PeriodicActivityScheduler::PeriodicActivityScheduler(FBFAssemblyProtocol& assembly, std::shared_ptr<TaskQueue> queue,
                                                     std::shared_ptr<PowerSource> power, PeriodicActivityHooks hooks,
                                                     std::filesystem::path lastRunFile)
    : assembly_(assembly),
      queue_(std::move(queue)),
      power_(std::move(power)),
      hooks_(std::move(hooks)),
      lastRunFile_(std::move(lastRunFile)),
      timer_(queue_->makeTimer()) {
  criteria_.interval = kDefaultInterval;
}

PeriodicActivityScheduler::~PeriodicActivityScheduler() { timer_->cancel(); }

void PeriodicActivityScheduler::start() {
  queue_->async([this] {
    // Check-in: only the criteria override applies.
    auto checkIn = std::make_shared<Activity>(criteria_, *power_, ActivityState::continueRunning);
    doPeriodicConduitActivity(checkIn, assembly_, hooks_);
    criteria_ = checkIn->criteria();
    scheduleNext();
  });
}

std::optional<SystemTime> PeriodicActivityScheduler::nextRunAt() const { return nextRun_; }

void PeriodicActivityScheduler::scheduleNext() {
  auto now = assembly_.currentDate();
  auto last = lastRun();
  SystemTime due = last ? *last + criteria_.interval : now;
  if (due <= now) {
    if (!criteria_.allowBattery && power_->onBattery()) {
      log().debug("Periodic flush is due but the machine is on battery; checking again later.");
      nextRun_ = now + kBatteryRecheck;
      timer_->schedule(kBatteryRecheck, [this] { scheduleNext(); });
      return;
    }
    nextRun_ = now;
    runNow();
    return;
  }
  nextRun_ = due;
  auto delay = std::chrono::duration_cast<std::chrono::steady_clock::duration>(due - now);
  timer_->schedule(delay, [this] { scheduleNext(); });
}

void PeriodicActivityScheduler::runNow() {
  auto activity = std::make_shared<Activity>(criteria_, *power_, ActivityState::run);
  doPeriodicConduitActivity(activity, assembly_, hooks_);
  criteria_ = activity->criteria();
  recordRun(assembly_.currentDate());
  scheduleNext();
}

std::optional<SystemTime> PeriodicActivityScheduler::lastRun() const {
  std::error_code ec;
  if (!assembly_.fileManager().exists(lastRunFile_)) return ranAt_;
  auto text = assembly_.fileManager().readFile(lastRunFile_, ec);
  if (!text) return ranAt_;
  std::optional<SystemTime> when;
  try {
    when = timeFromStoredSeconds(std::stod(*text));
  } catch (const std::exception&) {
  }
  if (!when) log().error("Ignoring unreadable last-run file {}", lastRunFile_.string());
  if (ranAt_ && (!when || *when < *ranAt_)) return ranAt_;
  return when;
}

void PeriodicActivityScheduler::recordRun(SystemTime when) {
  ranAt_ = when;
  std::error_code ec;
  if (!assembly_.fileManager().writeFileAtomically(lastRunFile_, std::to_string(secondsSinceEpoch(when)) + "\n", ec)) {
    log().error("Cannot record the last periodic run in {}: {}", lastRunFile_.string(), ec.message());
  }
}

}  // namespace fbf
