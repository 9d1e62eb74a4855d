// The upload pipeline under faults, with the real programs: slow and stalled
// receivers, few descriptors, kills in the middle of a flush, broken bags.
// Each case guards against losing or double-sending feedback, or against a
// daemon that stops serving.
#include "e2e/daemon_home.h"

#include <signal.h>

#include <random>
#include <thread>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

#if defined(__SANITIZE_ADDRESS__)
constexpr int kScale = 3;  // the sanitizers make every file several times dearer
#else
constexpr int kScale = 1;
#endif

using PipelineFaults = ReceiverTest;

// More sessions than the pruning bound, all still in flight when a slow
// flush settles: none may be pruned or reported as anything but delivered.
TEST_F(PipelineFaults, SlowReceiverNothingInFlightIsPrunedOrMisreported) {
  restartReceiver({"--delay-ms", "20"});
  ASSERT_EQ(home.generate(90, 12, 5).status, 0);
  const size_t files = home.sessionFiles().size() + home.customFiles().size();
  home.startDaemon();
  flush();
  // Custom files the generator made empty or too large are dropped by rule.
  EXPECT_EQ(lossesByReason(home.deletionEvents()).count(kPruned), 0u);
  EXPECT_EQ(home.daemonLog().find("Error deleting file after successful upload"), std::string::npos);
  EXPECT_TRUE(home.sessionFiles().empty());
  EXPECT_EQ(delivered(receiver->records()) + static_cast<size_t>(lossCount(home.deletionEvents())), files);
}

TEST_F(PipelineFaults, HundredsOfSessionsUnderALowDescriptorLimitAllArrive) {
  const int sessions = 240 / kScale;
  ASSERT_EQ(home.generate(sessions, 0, 6).status, 0);
  home.startDaemon(DaemonHome::descriptorLimit(80));
  flush();
  // Everything on disk was delivered, nothing dropped on the way.
  EXPECT_EQ(home.sessionFiles().size(), 0u);
  EXPECT_EQ(lossCount(home.deletionEvents()), 0)
      << nlohmann::json(home.deletionEvents()).dump().substr(0, 2000);
  EXPECT_GE(delivered(receiver->records()), static_cast<size_t>(sessions));
  EXPECT_EQ(home.daemonLog().find("Too many open files"), std::string::npos) << tail(home.daemonLog());
}

TEST_F(PipelineFaults, KillNineMidFlushThenRestartDeliversEverySessionAtMostOnceMorePerKill) {
  constexpr int kRounds = 3;
  const int perRound = 40 / kScale;
  restartReceiver({"--delay-ms", "3"});
  std::mt19937 random(20261123);
  for (int round = 0; round < kRounds; ++round) {
    ASSERT_EQ(home.generate(perRound, 0, 100 + round, "realistic").status, 0);
    home.startDaemon();
    auto flush = home.startFbfctl({"flush"}, home.root() / "flush.out");
    std::this_thread::sleep_for(std::chrono::milliseconds(30 + random() % 300));
    home.daemon()->signal(SIGKILL);
    home.daemon()->waitFor(10s);
    flush->waitFor(10s);
  }
  // A last run with nothing killed: recovery, then a whole flush. A session
  // killed in the middle of twice stays as a poison file, listed by status;
  // every other one arrives.
  home.startDaemon();
  flush();
  const size_t sessions = static_cast<size_t>(kRounds * perRound);
  const auto left = home.sessionFiles();
  for (const auto& name : left) EXPECT_TRUE(name.ends_with(".processing")) << name;
  auto status = home.fbfctl({"status", "--json"});
  ASSERT_EQ(status.status, 0) << status.err;
  EXPECT_EQ(nlohmann::json::parse(status.out).at("poisonFiles").size(), left.size()) << status.out;
  EXPECT_EQ(lossCount(home.deletionEvents()), 0);
  EXPECT_GE(delivered(receiver->records()) + left.size(), sessions);
  // A payload the receiver recorded but whose answer the kill cut off is sent
  // again: at most one per connection of the upload pool, which holds six.
  EXPECT_LE(delivered(receiver->records()), sessions + 6 * kRounds) << "too many duplicates per kill";
  EXPECT_LE(left.size(), sessions / 10) << "most sessions are interrupted at most once";
}

TEST_F(PipelineFaults, SessionsWaitForAMissingEndpointAndGoOnceTheBagIsFixed) {
  home.writeBag("", {{"feedback_url", "not a url"}});
  ASSERT_EQ(home.generate(5, 3, 7).status, 0);
  const auto before = home.sessionFiles();
  home.startDaemon();
  flush();
  EXPECT_EQ(home.sessionFiles(), before) << "claimed sessions without an endpoint";
  for (const auto& name : home.customFiles()) EXPECT_FALSE(name.ends_with(".uploadPending")) << name;
  EXPECT_TRUE(receiver->records().empty());

  home.writeBag(receiver->url());
  flush();
  EXPECT_TRUE(home.sessionFiles().empty()) << tail(home.daemonLog());
  EXPECT_GE(delivered(receiver->records()), before.size());
}

TEST_F(PipelineFaults, AnAbsurdAgeLimitKeepsEverythingAndTheDaemonAlive) {
  restartReceiver({"--status", "500"});
  home.writeBag(receiver->url(), {{"feedback_max_age_in_days", 1'000'000'000'000'000LL}});
  ASSERT_EQ(home.generate(4, 0, 8).status, 0);
  home.startDaemon();
  // Twice: the second flush retries the upload files the first one left.
  flush();
  flush();
  EXPECT_FALSE(home.daemon()->waitFor(0ms)) << "the daemon died";
  EXPECT_EQ(lossCount(home.deletionEvents()), 0);
  EXPECT_EQ(home.sessionFiles().size(), 4u);
  EXPECT_NE(home.daemonLog().find("too large to count in seconds"), std::string::npos);
}

// SIGTERM while uploads stall and more sessions wait than the pipeline holds:
// a prompt exit 0 between files, every session still on disk, none left
// half-claimed, and the walk stopped short.
TEST_F(PipelineFaults, SigtermDuringStalledUploadsExitsPromptlyAndKeepsEveryFile) {
  constexpr size_t kSessions = 90;  // more than the 64 the pipeline holds, fewer than pruning keeps
  restartReceiver({"--delay-ms", "120000"});
  ASSERT_EQ(home.generate(kSessions, 0, 9).status, 0);
  home.startDaemon();
  auto flush = home.startFbfctl({"flush"}, home.root() / "flush.out");
  ASSERT_TRUE(waitUntil([&] { return home.daemonLog().find("Enqueueing") != std::string::npos; }, 10s))
      << tail(home.daemonLog());
  std::this_thread::sleep_for(300ms);  // the transfers start and stall
  auto status = home.stopDaemon();
  ASSERT_TRUE(status) << "no exit after SIGTERM";
  EXPECT_EQ(*status, 0) << tail(home.daemonLog());
  const auto left = home.sessionFiles();
  EXPECT_EQ(left.size(), kSessions) << "a stalled upload's files must stay for the next run";
  size_t closed = 0;
  for (const auto& name : left) {
    EXPECT_FALSE(name.ends_with(".processing")) << "interrupted in the middle of " << name;
    closed += name.ends_with(".closed");
  }
  EXPECT_GT(closed, 0u) << "the walk was not stopped";
  EXPECT_EQ(lossCount(home.deletionEvents()), 0);
}

}  // namespace
}  // namespace fbf::testing
