#include "daemon/periodic_activity.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <thread>

namespace fbf::testing {
namespace {

class FixedPower final : public PowerSource {
 public:
  bool onBattery() const override { return battery; }
  std::atomic<bool> battery{false};
};

// Records what the finishing steps do; the flush completes when told.
struct RecordingHooks {
  int flushes = 0, stops = 0, invalidations = 0, exits = 0;
  std::vector<std::chrono::seconds> delays;
  bool completeAtOnce = true;
  std::function<void()> pendingCompletion;

  PeriodicActivityHooks hooks() {
    PeriodicActivityHooks h;
    h.beginFlush = [this](std::function<void()> completion) -> std::function<void()> {
      ++flushes;
      completeAtOnce ? completion() : void(pendingCompletion = std::move(completion));
      return [this] {
        ++stops;
        if (pendingCompletion) std::exchange(pendingCompletion, nullptr)();
      };
    };
    h.invalidateListener = [this] { ++invalidations; };
    h.onMainQueueAfter = [this](std::chrono::seconds d, std::function<void()> task) {
      delays.push_back(d);
      task();
    };
    h.requestCleanExit = [this] { ++exits; };
    return h;
  }
};

// Guards against: a flush started without a bag or while disabled, the process kept (or ended) against the no-exit flag, a flush not stopped on battery, or the interval override applied below one second.
class PeriodicRun : public ::testing::Test {
 protected:
  TestEnvironment env;
  std::shared_ptr<FixedPower> power = std::make_shared<FixedPower>();
  RecordingHooks recorder;
  LogCapture logs;

  std::shared_ptr<Activity> activity(ActivityState state = ActivityState::run) {
    return std::make_shared<Activity>(ActivityCriteria{std::chrono::hours(6), false, true}, *power,
                                      state);
  }
  void bag() { env.writeBag({{"feedback_url", "https://127.0.0.1:1/"}}); }
};

TEST_F(PeriodicRun, IntervalOverrideAppliesOnlyFromOneSecond) {
  auto a = activity();
  for (auto [seconds, interval] : {std::pair{0, 21600}, {-5, 21600}, {1, 1}}) {
    env.defaults().setObject("FlushFrequencyInSeconds", seconds);
    overrideActivityFrequencyIfNecessary(env.assembly(), *a);
    EXPECT_EQ(a->criteria().interval, std::chrono::seconds(interval));
    EXPECT_EQ(a->criteria().allowBattery, seconds == 1);
  }
  EXPECT_FALSE(a->criteria().requireScreenSleep);
}

TEST_F(PeriodicRun, EveryRunFinishesAndExitsTenSecondsLaterUnlessToldToStay) {
  const struct {
    const char* name;
    bool bag, disabled, noExit;
    int flushes;
    const char* log;
  } rows[] = {
      {"no bag", false, false, false, 0, "FBF bailing because we found no cached bag on disk."},
      {"disabled", true, true, false, 0,
       "FBF bailing because flushing is disabled. 'defaults delete vireond VIRFeedbackFlushDisabled' to re-enable"},
      {"flushed", true, false, false, 1, "FBF: FBF's now finished."},
      {"told to stay", true, false, true, 1, "Respecting NoExit defaults flag and staying alive, staying alive."},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    TestEnvironment env;
    RecordingHooks recorder;
    LogCapture logs;
    if (row.bag) env.writeBag({{"feedback_url", "https://127.0.0.1:1/"}});
    env.defaults().setObject("VIRFeedbackFlushDisabled", row.disabled);
    env.defaults().setObject("FBFNoExit", row.noExit);
    auto a = activity();
    doPeriodicConduitActivity(a, env.assembly(), recorder.hooks());
    env.manualQueue->drain();
    EXPECT_EQ(recorder.flushes, row.flushes);
    EXPECT_TRUE(logs.contains(row.log));
    EXPECT_EQ(recorder.invalidations, row.noExit ? 0 : 1);
    EXPECT_EQ(recorder.exits, row.noExit ? 0 : 1);
    EXPECT_EQ(recorder.delays, (std::vector<std::chrono::seconds>(row.noExit ? 0 : 1, std::chrono::seconds(10))));
    EXPECT_EQ(a->state(), ActivityState::done);
    EXPECT_TRUE(logs.contains("Conduit activity done."));
    EXPECT_FALSE(env.assembly().conduitActivity());
  }
}

TEST_F(PeriodicRun, GoingOnBatteryDefersTheRunningFlush) {
  bag();
  env.defaults().setObject("FBFNoExit", true);
  recorder.completeAtOnce = false;
  auto a = activity();
  std::thread handler([&] { doPeriodicConduitActivity(a, env.assembly(), recorder.hooks()); });
  // The handler polls once a second; it must see the change and stop the flush.
  power->battery = true;
  handler.join();
  EXPECT_EQ(recorder.stops, 1);
  EXPECT_TRUE(logs.contains("Deferring flush."));
  EXPECT_EQ(a->state(), ActivityState::done);
}

// Guards against: a due run skipped or repeated, a flush at check-in, a recent run not waited for, a run on battery, or an unreadable last-run record blocking flushes.
class Scheduling : public PeriodicRun {
 protected:
  std::shared_ptr<ManualQueue> queue = std::make_shared<ManualQueue>("activity");
  fs::path lastRunFile = env.cacheDir() / "fbf-last-flush";
  std::unique_ptr<PeriodicActivityScheduler> start() {
    bag();
    env.defaults().setObject("FBFNoExit", true);
    auto s = std::make_unique<PeriodicActivityScheduler>(env.assembly(), queue, power,
                                                         recorder.hooks(), lastRunFile);
    s->start();
    queue->drain();
    env.manualQueue->drain();
    return s;
  }
};

TEST_F(Scheduling, FirstStartOrAnUnreadableLastRunRunsAtOnceAndRemembersTheRun) {
  writeFile(lastRunFile, "yesterday");
  auto s = start();
  EXPECT_EQ(recorder.flushes, 1);
  EXPECT_TRUE(logs.contains("Ignoring unreadable last-run file"));
  auto next = s->nextRunAt();
  ASSERT_TRUE(next);
  // The run is stored to the microsecond.
  EXPECT_NEAR(std::chrono::duration<double>(*next - env.clock->now()).count(),
              static_cast<double>(PeriodicActivityScheduler::kDefaultInterval.count()), 1.0);
  fs::remove(lastRunFile);
  start();
  EXPECT_EQ(recorder.flushes, 2);
  EXPECT_TRUE(fs::exists(lastRunFile));
}

TEST_F(Scheduling, AnUnwritableLastRunRecordStillWaitsAnIntervalBeforeTheNextRun) {
  lastRunFile = env.cacheDir() / "gone" / "fbf-last-flush";
  auto s = start();
  EXPECT_EQ(recorder.flushes, 1) << "a run that cannot be recorded ran again at once";
  EXPECT_TRUE(logs.contains("Cannot record the last periodic run"));
  ASSERT_TRUE(s->nextRunAt());
  EXPECT_GT(*s->nextRunAt(), env.clock->now() + std::chrono::hours(1));
}

TEST_F(Scheduling, RecentRunArmsTheTimerInstead) {
  writeFile(lastRunFile,
            std::to_string(secondsSinceEpoch(env.clock->now() - std::chrono::hours(1))));
  auto s = start();
  EXPECT_EQ(recorder.flushes, 0);
  // Five hours later (the stored time is decimal seconds, so allow a
  // moment for rounding) the timer fires.
  env.clock->advance(std::chrono::hours(5) + std::chrono::seconds(1));
  queue->advance(std::chrono::hours(5) + std::chrono::seconds(1));
  env.manualQueue->drain();
  EXPECT_EQ(recorder.flushes, 1);
}

TEST_F(Scheduling, DueRunWaitsWhileOnBatteryUnlessOverridden) {
  power->battery = true;
  auto s = start();
  EXPECT_EQ(recorder.flushes, 0);
  power->battery = false;
  queue->advance(PeriodicActivityScheduler::kBatteryRecheck);
  env.manualQueue->drain();
  EXPECT_EQ(recorder.flushes, 1);
}

}  // namespace
}  // namespace fbf::testing
