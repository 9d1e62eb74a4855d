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

// Guards against: the completion run before the daemon finished, or the connection left open after the answer.
TEST_F(AClientObjectForOneRequest, FlushesASessionEagerlyAndCompletesAfterTheDaemonFinished) {
  runner->holdCompletions(true);
  auto connection = connectClient();
  FlusherClient client(connection);
  std::atomic<bool> completed{false};
  client.flushSessionEagerly(sessionPath(), [&] { completed = true; });
  ASSERT_TRUE(eventually([&] { return runner->heldCount() == 1; }));
  EXPECT_FALSE(completed.load());

  assembly->workloop().sync([&] { runner->releaseAll(); });
  ASSERT_TRUE(eventually([&] { return completed.load(); }));
  EXPECT_TRUE(logs.contains("Eager flush finished"));
  ASSERT_TRUE(eventually([&] { return !connection->isValid() && openConnections() == 0; }));
}

// Guards against: a second request answered on a connection the first closed, or a completion-less request lost.
TEST_F(AClientObjectForOneRequest, ASecondRequestGetsNoReplyOnceTheFirstHasClosedTheConnection) {
  runner->holdCompletions(true);
  auto connection = connectClient();
  FlusherClient client(connection);
  std::atomic<int> flushCompletions{0};
  client.flushSessionEagerly(sessionPath(), [&] { ++flushCompletions; });
  ASSERT_TRUE(eventually([&] { return runner->heldCount() == 1; }));
  client.updateWhitelists(1);

  ASSERT_TRUE(eventually([&] { return logs.contains("Whitelist generation queued"); }));
  ASSERT_TRUE(eventually([&] { return openConnections() == 0; }));
  EXPECT_EQ(conditions(), std::vector<uint64_t>{1});
  // The flush finishes only now; its answer has nowhere to go.
  assembly->workloop().sync([&] { runner->releaseAll(); });
  ioIdle();
  EXPECT_EQ(flushCompletions.load(), 0);
  EXPECT_TRUE(logs.contains("fbf connection closed with error: connection invalidated"));
}

// Guards against: a completion run when the daemon went away, or a request sent without a connection.
TEST_F(AClientObjectForOneRequest, WithoutADaemonTheCompletionIsNeverCalled) {
  runner->holdCompletions(true);
  auto connection = connectClient();
  FlusherClient client(connection);
  std::atomic<bool> completed{false};
  client.flushSessionEagerly(sessionPath(), [&] { completed = true; });
  ASSERT_TRUE(eventually([&] { return runner->heldCount() == 1; }));
  service.reset();  // the daemon goes away with the request outstanding
  ASSERT_TRUE(eventually([&] { return logs.contains("fbf connection closed with error: "); }));

  FlusherClient unconnected(nullptr);
  unconnected.flushSessionEagerly(sessionPath(), [&] { completed = true; });
  unconnected.updateWhitelists(0, [&] { completed = true; });
  EXPECT_EQ(logs.count("FBF proxy didn't conform to expected remote object protocol"), 2u);
  EXPECT_FALSE(completed.load());
  EXPECT_FALSE(logs.contains("Eager flush finished"));
}

}  // namespace
}  // namespace fbf::testing
