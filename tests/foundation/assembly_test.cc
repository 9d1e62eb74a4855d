#include "support/test_support.h"

#include <gtest/gtest.h>

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
