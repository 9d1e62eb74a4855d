// The periodic flush activity.
//
// There is no platform activity scheduler on Linux, so the daemon carries a
// small one: it remembers when the last run completed (a file in the cache
// directory), runs at once when the daemon starts after the interval has
// passed (the systemd timer starts the daemon periodically), and otherwise
// arms a timer for the next run. A run is held back while the machine is on
// battery unless the criteria allow battery; during a run the same test is the
// "should defer" answer, polled every second.
//
// The handler runs on a queue of its own ("vireon-fbf.activity") and blocks
// there while the flush runs on the work queue.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "platform/task_queue.h"

#include <atomic>
#include <chrono>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>

namespace fbf {

// Scheduler state numbers.
enum class ActivityState : int { run = 2, continueRunning = 4, done = 5 };

struct ActivityCriteria {
  std::chrono::seconds interval{0};
  bool allowBattery = false;
  bool requireScreenSleep = false;
};

// Reports whether the machine runs on battery (sysfs power_supply).
class PowerSource {
 public:
  virtual ~PowerSource() = default;
  virtual bool onBattery() const = 0;
};
std::unique_ptr<PowerSource> makeSysfsPowerSource(std::filesystem::path root = "/sys/class/power_supply");

// One run of the activity, as the handler sees it.
class Activity final : public ConduitActivity {
 public:
  // `power` must outlive the activity (the scheduler owns both).
  Activity(ActivityCriteria criteria, const PowerSource& power, ActivityState state)
      : criteria_(criteria), power_(power), state_(state) {}
  bool shouldDefer() const override { return !criteria_.allowBattery && power_.onBattery(); }
  ActivityState state() const { return state_; }
  bool setState(ActivityState s) {
    state_ = s;
    return true;
  }
  const ActivityCriteria& criteria() const { return criteria_; }
  void setCriteria(ActivityCriteria c) { criteria_ = c; }

 private:
  ActivityCriteria criteria_;
  const PowerSource& power_;
  ActivityState state_;
};

// What a run needs from the rest of the daemon.
struct PeriodicActivityHooks {
  // Starts a flush of everything; `completion` is called once when it ends.
  // The returned function asks the running flush to stop after its file.
  std::function<std::function<void()>(std::function<void()> completion)> beginFlush;
  // No new clients after a run that will end the process.
  std::function<void()> invalidateListener;
  // Schedules `task` on the main loop after `delay`.
  std::function<void(std::chrono::seconds delay, std::function<void()> task)> onMainQueueAfter;
  std::function<void()> requestCleanExit;
};

// The handler (step by step as the activity contract has it): returns at once
// unless the activity is in the run state; otherwise flushes and always runs
// the finishing steps.
void doPeriodicConduitActivity(const std::shared_ptr<Activity>& activity, FBFAssemblyProtocol& assembly,
                               const PeriodicActivityHooks& hooks);
void overrideActivityFrequencyIfNecessary(FBFAssemblyProtocol& assembly, Activity& activity);

// The in-process scheduler.
class PeriodicActivityScheduler {
 public:
  static constexpr std::chrono::seconds kDefaultInterval{6 * 3600};
  static constexpr std::chrono::seconds kBatteryRecheck{60};

  PeriodicActivityScheduler(FBFAssemblyProtocol& assembly, std::shared_ptr<TaskQueue> activityQueue,
                            std::shared_ptr<PowerSource> power, PeriodicActivityHooks hooks,
                            std::filesystem::path lastRunFile);
  ~PeriodicActivityScheduler();

  // Check-in: applies the override, then runs now or arms the timer.
  void start();
  // When the next run is due (for status and tests).
  std::optional<SystemTime> nextRunAt() const;

 private:
  void scheduleNext();
  void runNow();
  std::optional<SystemTime> lastRun() const;
  void recordRun(SystemTime when);

  FBFAssemblyProtocol& assembly_;
  std::shared_ptr<TaskQueue> queue_;
  std::shared_ptr<PowerSource> power_;
  PeriodicActivityHooks hooks_;
  std::filesystem::path lastRunFile_;
  ActivityCriteria criteria_;
  std::unique_ptr<Timer> timer_;
  std::optional<SystemTime> nextRun_;
  // The last run of this process, kept in case its record cannot be written:
  // without it, an unwritable record would make the run due again at once.
  std::optional<SystemTime> ranAt_;
};

}  // namespace fbf
