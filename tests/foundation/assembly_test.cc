#include "assembly/feedback_loss_ledger.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <tuple>

namespace fbf::testing {
namespace {

// Guards against: a cancelled flush going on without a listener, or stopping with one.
TEST(AssemblyFlags, ShouldProceedHonoursListenersOverCancellation) {
  TestEnvironment env;
  auto& a = env.assembly();
  auto check = [&] {
    bool result = false;
    env.manualQueue->sync([&] { result = a.shouldProceed(); });
    return result;
  };
  EXPECT_TRUE(check());
  a.setCancelled(true);
  EXPECT_FALSE(check());
  a.setCohortsListener(std::make_shared<RecordingConduit>());
  EXPECT_TRUE(check());
  a.setCohortsListener(nullptr);
  a.setUploadListener(std::make_shared<RecordingConduit>());
  EXPECT_TRUE(check());
}

// Guards against: upload sessions that do not hold a transaction while open, or lose their settings.
TEST(UploadSessionTransactions, TwoMadeOneInvalidatedLeavesOneOpen) {
  TestEnvironment env;
  std::vector<std::shared_ptr<FakeHttpSession>> made;
  env.httpSessionFactory = [&](HttpSessionConfiguration c) {
    made.push_back(std::make_shared<FakeHttpSession>(std::move(c)));
    return made.back();
  };
  env.defaults().setObject("VIRUploadPinnedPublicKeys", "sha256//abc");
  auto& a = env.assembly();
  auto s1 = a.makeUploadSession();
  auto s2 = a.makeUploadSession();
  env.manualQueue->drain();
  EXPECT_EQ(a.openTransactionCount(), 2u);
  EXPECT_EQ(env.transactions->openCount(), 2);
  EXPECT_EQ(made[0]->config.pinnedPublicKeys, "sha256//abc");

  s1->finishTasksAndInvalidate();
  env.manualQueue->drain();
  EXPECT_EQ(a.openTransactionCount(), 1u);
  EXPECT_EQ(env.transactions->openCount(), 1);
}

// Guards against: opening the loss ledger losing events of the last week,
// keeping what left it, or a bogus head line stopping every later pruning.
TEST(FeedbackLossLedger, OpeningDropsTheStaleHeadAndKeepsTheWeek) {
  const SystemTime now = timeFromSeconds(1'800'000'000);
  auto line = [&](double daysAgo, int reason) {
    return "{\"time\":" + std::to_string(secondsSinceEpoch(now) - daysAgo * 86400) +
           ",\"type\":1,\"reason\":" + std::to_string(reason) + "}\n";
  };
  struct Case {
    const char* name;
    std::string before;
    std::vector<FeedbackLossCount> counts;  // the week's, after opening
    size_t lines;                           // left in the file
  };
  const std::vector<Case> cases = {
      {"stale and corrupt head", line(9, 1) + "{oops\n" + line(8, 2) + line(2, 3) + line(1, 3), {{1, 3, 2}}, 2},
      {"a clock error far ahead", line(-30, 4) + line(1, 5), {{1, 5, 1}}, 1},
      {"all in the week", line(3, 6) + line(2, 6), {{1, 6, 2}}, 2},
      {"clock set back behind the head", line(1, 7) + line(10, 8), {{1, 7, 1}}, 2},
  };
  for (const auto& c : cases) {
    TempDir dir;
    auto fm = makePosixFileManager(XdgDirectories::underRoot(dir.path()));
    const fs::path file = dir.path() / "state" / "losses.jsonl";
    fs::create_directories(file.parent_path());
    std::ofstream(file) << c.before;
    {
      FeedbackLossLedger ledger(file, *fm, now);
      auto counts = ledger.countsSince(now - FeedbackLossLedger::kWindow);
      ASSERT_EQ(counts.size(), c.counts.size()) << c.name;
      for (size_t i = 0; i < counts.size(); ++i) {
        EXPECT_EQ(std::tie(counts[i].feedbackType, counts[i].reason, counts[i].files),
                  std::tie(c.counts[i].feedbackType, c.counts[i].reason, c.counts[i].files))
            << c.name;
      }
    }
    std::ifstream in(file);
    EXPECT_EQ(static_cast<size_t>(std::count(std::istreambuf_iterator<char>(in), {}, '\n')), c.lines) << c.name;
  }
}

// Guards against: a clean exit that does not wait for every open transaction, or happens twice.
TEST(CleanExit, WaitsForTheLastOpenTransactionAndHappensOnce) {
  int exits = 0;
  TransactionRegistry registry([&] { ++exits; });
  auto t1 = registry.begin("one");
  auto t2 = registry.begin("two");
  registry.requestCleanExit();
  t1.reset();
  EXPECT_EQ(exits, 0);
  t2.reset();
  EXPECT_EQ(exits, 1);
  registry.begin("late").reset();
  EXPECT_EQ(exits, 1);
  TransactionRegistry idle([&] { ++exits; });
  idle.requestCleanExit();
  EXPECT_EQ(exits, 2) << "at once when nothing is open";
}

}  // namespace
}  // namespace fbf::testing
