// The one-request client object: its log lines, its completion, and the
// closing of its connection after the daemon's answer.

#include "ipc/flusher_client.h"
#include "ipc_fixture.h"

#include <atomic>

namespace fbf::testing {
namespace {

class AClientObjectForOneRequest : public IpcFixture {
 protected:
  fs::path sessionPath() const { return env.cacheDir() / "session.7.0A1B.closed"; }
};

TEST_F(AClientObjectForOneRequest, FlushesASessionEagerlyAndCompletesAfterTheDaemonFinished) {
  runner->holdCompletions(true);
  auto connection = connectClient();
  FlusherClient client(connection);
  EXPECT_TRUE(logs.contains("Initiating new connection to FBF"));

  std::atomic<bool> completed{false};
  client.flushSessionEagerly(sessionPath(), [&] { completed = true; });
  ASSERT_TRUE(eventually([&] { return runner->heldCount() == 1; }));
  EXPECT_TRUE(logs.contains("Flushing session " + sessionPath().string() + " eagerly."));
  EXPECT_FALSE(completed.load());

  assembly->workloop().sync([&] { runner->releaseAll(); });
  ASSERT_TRUE(eventually([&] { return completed.load(); }));
  EXPECT_TRUE(logs.contains("Eager flush finished"));
  ASSERT_TRUE(eventually([&] { return !connection->isValid(); }));
}

TEST_F(AClientObjectForOneRequest, WithoutACompletionStillLogsAndClosesAfterTheReply) {
  auto connection = connectClient();
  FlusherClient client(connection);
  client.updateWhitelists(static_cast<uint64_t>(FBFUpdateWhitelistCondition::soon));

  ASSERT_TRUE(eventually([&] { return logs.contains("Whitelist generation queued"); }));
  EXPECT_TRUE(logs.contains("Asking FBF to generate App Whitelist signature."));
  ASSERT_TRUE(eventually([&] { return !connection->isValid(); }));
  ASSERT_TRUE(eventually([&] { return openConnections() == 0; }));
  assembly->workloop().sync([&] { EXPECT_EQ(controller->conditions, std::vector<uint64_t>{1}); });
}

TEST_F(AClientObjectForOneRequest, ASecondRequestGetsNoReplyOnceTheFirstHasClosedTheConnection) {
  runner->holdCompletions(true);
  auto connection = connectClient();
  FlusherClient client(connection);
  std::atomic<int> whitelistCompletions{0};
  std::atomic<int> flushCompletions{0};

  client.flushSessionEagerly(sessionPath(), [&] { ++flushCompletions; });
  ASSERT_TRUE(eventually([&] { return runner->heldCount() == 1; }));
  client.updateWhitelists(0, [&] { ++whitelistCompletions; });

  ASSERT_TRUE(eventually([&] { return whitelistCompletions.load() == 1; }));
  ASSERT_TRUE(eventually([&] { return openConnections() == 0; }));
  // The flush finishes only now; its answer has nowhere to go.
  assembly->workloop().sync([&] { runner->releaseAll(); });
  std::promise<void> ioIdle;
  asio::post(io, [&] { ioIdle.set_value(); });
  ioIdle.get_future().wait();

  EXPECT_EQ(flushCompletions.load(), 0);
  EXPECT_FALSE(connection->isValid());
  EXPECT_TRUE(logs.contains("fbf connection closed with error: connection invalidated"));
}

TEST_F(AClientObjectForOneRequest, LogsAFailedConnectionAndNeverCompletes) {
  runner->holdCompletions(true);
  auto connection = connectClient();
  FlusherClient client(connection);
  std::atomic<bool> completed{false};
  client.flushSessionEagerly(sessionPath(), [&] { completed = true; });
  ASSERT_TRUE(eventually([&] { return runner->heldCount() == 1; }));

  service.reset();  // the daemon goes away with the request outstanding
  ASSERT_TRUE(eventually([&] { return logs.contains("fbf connection closed with error: "); }));
  EXPECT_FALSE(completed.load());
  EXPECT_FALSE(logs.contains("Eager flush finished"));
}

TEST_F(AClientObjectForOneRequest, WithoutADaemonSpeakingTheProtocolLeavesTheCompletionUncalled) {
  FlusherClient client(nullptr);
  bool completed = false;
  client.flushSessionEagerly(sessionPath(), [&] { completed = true; });
  client.updateWhitelists(0, [&] { completed = true; });
  EXPECT_FALSE(completed);
  EXPECT_EQ(logs.count("FBF proxy didn't conform to expected remote object protocol"), 2u);
  EXPECT_FALSE(logs.contains("Flushing session"));
}

}  // namespace
}  // namespace fbf::testing
