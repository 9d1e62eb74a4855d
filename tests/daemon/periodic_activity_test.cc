#include "daemon/periodic_activity.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <thread>

namespace fbf {
namespace {

using testing::LogCapture;
using testing::TestEnvironment;

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
      if (completeAtOnce) {
        completion();
      } else {
        pendingCompletion = std::move(completion);
      }
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

class PeriodicRun : public ::testing::Test {
 protected:
  TestEnvironment env;
  FixedPower power;
  RecordingHooks recorder;
  LogCapture logs;

  std::shared_ptr<Activity> activity(ActivityState state = ActivityState::run) {
    return std::make_shared<Activity>(ActivityCriteria{std::chrono::hours(6), false, true}, power, state);
  }
  void run(const std::shared_ptr<Activity>& a) {
    doPeriodicConduitActivity(a, env.assembly(), recorder.hooks());
    env.manualQueue->drain();
  }
};

TEST_F(PeriodicRun, IntervalOverrideAppliesOnlyFromOneSecond) {
  auto a = activity();
  env.defaults().setObject("FlushFrequencyInSeconds", 0);
  overrideActivityFrequencyIfNecessary(env.assembly(), *a);
  EXPECT_EQ(a->criteria().interval, std::chrono::hours(6));
  env.defaults().setObject("FlushFrequencyInSeconds", -5);
  overrideActivityFrequencyIfNecessary(env.assembly(), *a);
  EXPECT_FALSE(a->criteria().allowBattery);

  env.defaults().setObject("FlushFrequencyInSeconds", 3600);
  overrideActivityFrequencyIfNecessary(env.assembly(), *a);
  EXPECT_EQ(a->criteria().interval, std::chrono::seconds(3600));
  EXPECT_TRUE(a->criteria().allowBattery);
  EXPECT_FALSE(a->criteria().requireScreenSleep);
}

TEST_F(PeriodicRun, CheckInDoesNothingButTheOverride) {
  env.writeBag({{"feedback_url", "https://127.0.0.1:1/"}});
  auto a = activity(ActivityState::continueRunning);
  run(a);
  EXPECT_EQ(recorder.flushes, 0);
  EXPECT_EQ(recorder.exits, 0);
  EXPECT_EQ(a->state(), ActivityState::continueRunning);
}

TEST_F(PeriodicRun, DisabledFlushStillFinishesAndExitsTenSecondsLater) {
  env.writeBag({{"feedback_url", "https://127.0.0.1:1/"}});
  env.defaults().setObject("VIRFeedbackFlushDisabled", true);
  auto a = activity();
  run(a);
  EXPECT_EQ(recorder.flushes, 0);
  EXPECT_TRUE(logs.contains(
      "FBF bailing because flushing is disabled. 'defaults delete vireond VIRFeedbackFlushDisabled' to re-enable"));
  EXPECT_EQ(recorder.invalidations, 1);
  ASSERT_EQ(recorder.delays.size(), 1u);
  EXPECT_EQ(recorder.delays[0], std::chrono::seconds(10));
  EXPECT_EQ(recorder.exits, 1);
  EXPECT_TRUE(logs.contains("FBF: FBF's now finished."));
  EXPECT_EQ(a->state(), ActivityState::done);
  EXPECT_TRUE(logs.contains("Conduit activity done."));
}

TEST_F(PeriodicRun, NoBagMeansNoFlush) {
  run(activity());
  EXPECT_EQ(recorder.flushes, 0);
  EXPECT_TRUE(logs.contains("FBF bailing because we found no cached bag on disk."));
  EXPECT_EQ(recorder.exits, 1);
}

TEST_F(PeriodicRun, NoExitKeepsTheListenerAndTheProcess) {
  env.writeBag({{"feedback_url", "https://127.0.0.1:1/"}});
  env.defaults().setObject("FBFNoExit", true);
  run(activity());
  EXPECT_EQ(recorder.flushes, 1);
  EXPECT_EQ(recorder.invalidations, 0);
  EXPECT_EQ(recorder.exits, 0);
  EXPECT_TRUE(logs.contains("Respecting NoExit defaults flag and staying alive, staying alive."));
  EXPECT_FALSE(env.assembly().conduitActivity());
}

TEST_F(PeriodicRun, GoingOnBatteryDefersTheRunningFlush) {
  env.writeBag({{"feedback_url", "https://127.0.0.1:1/"}});
  env.defaults().setObject("FBFNoExit", true);
  recorder.completeAtOnce = false;
  auto a = activity();
  std::thread handler([&] { doPeriodicConduitActivity(a, env.assembly(), recorder.hooks()); });
  // The handler polls once a second; it must see the change and stop the flush.
  power.battery = true;
  handler.join();
  EXPECT_EQ(recorder.stops, 1);
  EXPECT_TRUE(logs.contains("Deferring flush."));
  EXPECT_EQ(a->state(), ActivityState::done);
}

class Scheduling : public PeriodicRun {
 protected:
  std::shared_ptr<testing::ManualQueue> queue = std::make_shared<testing::ManualQueue>("activity");
  std::shared_ptr<FixedPower> sharedPower = std::make_shared<FixedPower>();
  fs::path lastRun() { return env.cacheDir() / "fbf-last-flush"; }
  std::unique_ptr<PeriodicActivityScheduler> make() {
    env.writeBag({{"feedback_url", "https://127.0.0.1:1/"}});
    env.defaults().setObject("FBFNoExit", true);
    return std::make_unique<PeriodicActivityScheduler>(env.assembly(), queue, sharedPower, recorder.hooks(), lastRun());
  }
};

TEST_F(Scheduling, FirstStartRunsAtOnceAndRemembersTheRun) {
  auto s = make();
  s->start();
  queue->drain();
  env.manualQueue->drain();
  EXPECT_EQ(recorder.flushes, 1);
  ASSERT_TRUE(fs::exists(lastRun()));
  auto next = s->nextRunAt();
  ASSERT_TRUE(next);
  // The run is stored to the microsecond.
  EXPECT_NEAR(std::chrono::duration<double>(*next - env.clock->now()).count(),
              static_cast<double>(PeriodicActivityScheduler::kDefaultInterval.count()), 1.0);
}

TEST_F(Scheduling, RecentRunArmsTheTimerInstead) {
  testing::writeFile(lastRun(), std::to_string(secondsSinceEpoch(env.clock->now() - std::chrono::hours(1))));
  auto s = make();
  s->start();
  queue->drain();
  EXPECT_EQ(recorder.flushes, 0);
  // Five hours later (the stored time is decimal seconds, so allow a
  // moment for rounding) the timer fires.
  env.clock->advance(std::chrono::hours(5) + std::chrono::seconds(1));
  queue->advance(std::chrono::hours(5) + std::chrono::seconds(1));
  env.manualQueue->drain();
  EXPECT_EQ(recorder.flushes, 1);
}

TEST_F(Scheduling, DueRunWaitsWhileOnBatteryUnlessOverridden) {
  sharedPower->battery = true;
  auto s = make();
  s->start();
  queue->drain();
  EXPECT_EQ(recorder.flushes, 0);
  sharedPower->battery = false;
  queue->advance(PeriodicActivityScheduler::kBatteryRecheck);
  env.manualQueue->drain();
  EXPECT_EQ(recorder.flushes, 1);
}

TEST_F(Scheduling, UnreadableLastRunFileCountsAsNoRun) {
  testing::writeFile(lastRun(), "yesterday");
  auto s = make();
  s->start();
  queue->drain();
  EXPECT_EQ(recorder.flushes, 1);
  EXPECT_TRUE(logs.contains("Ignoring unreadable last-run file"));
}

}  // namespace
}  // namespace fbf
