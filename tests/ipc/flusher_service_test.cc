// The daemon's service over a real socket: every request kind answered, the
// listener slots and their clearing when a connection goes away, and peers
// that break the framing without disturbing anyone else.

#include "ipc/control_client.h"
#include "ipc/frame_channel.h"
#include "ipc_fixture.h"

#include <unistd.h>

namespace fbf::testing {
namespace {

ipc::Request request(void (*set)(ipc::Request&), uint64_t id = 0) {
  ipc::Request r;
  set(r);
  r.set_id(id);
  return r;
}
void flush(ipc::Request& r) { r.mutable_flush(); }
void teeUploads(ipc::Request& r) { r.mutable_teeuploads(); }
void teeCohorts(ipc::Request& r) { r.mutable_teecohortsfeedback(); }

class AClientAskingTheDaemon : public IpcFixture {};

// Guards against: a request kind routed wrongly, a missing argument unreported, or the connection ended by a refusal.
TEST_F(AClientAskingTheDaemon, EachRequestKindGetsItsAnswer) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  auto session = env.cacheDir() / "session.42.0A1B.closed";
  struct Row {
    const char* name;
    std::function<ipc::ControlOutcome()> call;
    std::string error;  // empty: ok
  };
  const Row rows[] = {
      {"custom type", [&] { return client->flushCustomFeedbackType("UserReport"); }, ""},
      {"no custom type", [&] { return client->flushCustomFeedbackType(""); }, "missing custom feedback type"},
      {"session", [&] { return client->flushSessionEagerly(session); }, ""},
      {"no session", [&] { return client->flushSessionEagerly(""); }, "missing session file path"},
      {"whitelists", [&] { return client->updateWhitelists(2); }, ""},
      {"flush", [&] { return client->flush(); }, ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    auto outcome = row.call();
    EXPECT_EQ(outcome.ok, row.error.empty());
    EXPECT_EQ(outcome.error, row.error);
  }
  EXPECT_EQ(runner->calls(), (std::vector<std::string>{"flushCustomFeedbackType UserReport",
                                                       "flushSessionEagerly " + session.string(), "flushAll"}));
  EXPECT_EQ(client->updateWhitelists(1).whitelistSignature, "signature-1");
  EXPECT_EQ(conditions(), (std::vector<uint64_t>{2, 1}));

  auto raw = connectClient();
  raw->resume();
  auto answer = ask(*raw, ipc::Request());
  ASSERT_TRUE(answer.message) << answer.error;
  EXPECT_FALSE(answer.message->reply().ok());
  EXPECT_EQ(answer.message->reply().error(), "unknown or missing operation");
  answer = ask(*raw, request(flush));
  ASSERT_TRUE(answer.message) << answer.error;
  EXPECT_TRUE(answer.message->reply().ok());
}

class ADaemonWithoutWhitelistMaintenance : public IpcFixture {
 protected:
  bool withWhitelistController() const override { return false; }
};

// Guards against: a whitelist update without a controller crashing or succeeding.
TEST_F(ADaemonWithoutWhitelistMaintenance, RefusesAWhitelistUpdateWithAReason) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  EXPECT_EQ(client->updateWhitelists(0).error, "whitelist maintenance unavailable");
}

class ListenersOfUploadsAndCohorts : public IpcFixture {
 protected:
  struct Listener {
    std::shared_ptr<ipc::DaemonConnection> connection;
    std::mutex m;
    std::vector<ipc::DaemonMessage> received;
    size_t count() {
      std::lock_guard l(m);
      return received.size();
    }
  };

  std::unique_ptr<Listener> subscribe(bool uploads, bool cohorts) {
    auto listener = std::make_unique<Listener>();
    listener->connection = connectClient();
    listener->connection->setMessageHandler([l = listener.get()](const ipc::DaemonMessage& m) {
      std::lock_guard lock(l->m);
      l->received.push_back(m);
    });
    listener->connection->resume();
    for (auto [wanted, kind] : {std::pair{uploads, &teeUploads}, std::pair{cohorts, &teeCohorts}}) {
      if (!wanted) continue;
      auto answer = ask(*listener->connection, request(kind));
      EXPECT_TRUE(answer.message && answer.message->reply().ok()) << answer.error;
    }
    return listener;
  }
  void upload(const std::string& data) {
    assembly->workloop().sync([&] {
      if (auto l = assembly->uploadListener()) l->willUploadData(data, "FeedbackV2");
    });
  }
};

// Guards against: a slot kept for a subscriber that left, or cleared for the wrong one.
TEST_F(ListenersOfUploadsAndCohorts, TheSecondSubscriberReplacesTheFirstAndTheFirstLeavingClearsTheSlot) {
  auto first = subscribe(true, false);
  auto second = subscribe(true, false);
  upload("only for the second");
  ASSERT_TRUE(eventually([&] { return second->count() == 1; }));
  EXPECT_EQ(first->count(), 0u);
  ASSERT_EQ(openConnections(), 2u);

  first->connection->invalidate();
  ASSERT_TRUE(eventually([&] { return openConnections() == 1; }));
  EXPECT_TRUE(logs.contains("clearing the sending stream listener"));
  // Cleared although the second subscriber is still connected.
  EXPECT_EQ(uploadListener(), nullptr);
  EXPECT_TRUE(second->connection->isValid());
}

// Guards against: a wrong status, or a listener slot left set or a late payload unlogged after its subscriber left.
TEST_F(ListenersOfUploadsAndCohorts, AConnectionHoldingBothClearsBothWhenItLeaves) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  std::string error;
  auto status = client->status(&error);
  ASSERT_TRUE(status) << error;
  EXPECT_FALSE(status->uploadslistener() || status->cohortslistener());
  EXPECT_EQ(status->pid(), getpid());
  EXPECT_NE(status->version().find("vireon-fbf/"), std::string::npos);

  auto both = subscribe(true, true);
  status = client->status(&error);
  ASSERT_TRUE(status) << error;
  EXPECT_TRUE(status->uploadslistener() && status->cohortslistener());
  EXPECT_EQ(status->sessions(0).files(), 3u);
  auto proxy = uploadListener();
  both->connection->invalidate();
  ASSERT_TRUE(eventually([&] { return openConnections() == 1; }));
  EXPECT_EQ(uploadListener(), nullptr);
  EXPECT_EQ(cohortsListener(), nullptr);
  EXPECT_TRUE(logs.contains("invalidating connection from PID " + std::to_string(getpid())));
  EXPECT_TRUE(logs.contains("clearing the cohorts listener"));
  // A flush that took the proxy before the slot was cleared still calls it.
  assembly->workloop().sync([&] { proxy->willUploadData("late", "FeedbackV2"); });
  EXPECT_TRUE(eventually([&] { return logs.contains("remote proxy error: "); }));
}

// A peer writing raw bytes on the socket, read back synchronously.
class RawPeer {
 public:
  explicit RawPeer(const fs::path& path) : socket_(io_) {
    socket_.connect(asio::local::stream_protocol::endpoint(path.string()));
  }
  void write(const std::string& bytes) { asio::write(socket_, asio::buffer(bytes)); }
  void shutdownSending() { socket_.shutdown(asio::socket_base::shutdown_send); }
  // The next frame, or no value when the daemon closed the connection.
  std::optional<std::string> readFrame() {
    uint8_t header[ipc::kFrameHeaderBytes];
    std::error_code ec;
    asio::read(socket_, asio::buffer(header), ec);
    if (ec) return std::nullopt;
    std::string body(ipc::decodeFrameHeader(header), '\0');
    asio::read(socket_, asio::buffer(body), ec);
    return ec ? std::nullopt : std::optional(body);
  }

 private:
  asio::io_context io_;
  asio::local::stream_protocol::socket socket_;
};

class PeersBreakingTheFraming : public IpcFixture {};

// Guards against: a broken frame unanswered or unlogged, its connection kept, earlier requests dropped, others hurt.
TEST_F(PeersBreakingTheFraming, OnlyTheBrokenConnectionEnds) {
  auto wellBehaved = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(wellBehaved);
  struct Row {
    const char* name;
    std::string bytes;
    const char* logLine;
    std::vector<uint64_t> failedReplies;  // ids of the "not ok" replies before the close
    size_t flushes;                       // requests served before the broken frame
  };
  const Row rows[] = {
      {"undecodable", ipc::encodeFrame(std::string("\xff\xff\xff\xff\xff\xff", 6)), "does not decode", {0}, 0},
      {"oversized", ipc::encodeFrameHeader(static_cast<uint32_t>(ipc::kMaxRequestFrameBytes + 1)),
       "exceeds the limit", {}, 0},
      {"half a header", std::string(2, '\0'), "went away after 2 of 4 header bytes", {}, 0},
      {"cut short", ipc::encodeFrameHeader(100) + std::string(10, 'x'), "went away after 10 of 100 bytes", {}, 0},
      {"request before a broken frame", ipc::encodeFrame(request(flush, 7).SerializeAsString()) +
       ipc::encodeFrameHeader(50), "went away after 0 of 50 bytes", {}, 1},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    size_t before = runner->calls().size();
    RawPeer peer(socketPath());
    peer.write(row.bytes);
    peer.shutdownSending();
    std::vector<uint64_t> failedReplies;
    while (auto frame = peer.readFrame()) {
      ipc::DaemonMessage message;
      ASSERT_TRUE(message.ParseFromString(*frame));
      if (!message.reply().ok()) failedReplies.push_back(message.reply().id());
    }
    EXPECT_EQ(failedReplies, row.failedReplies);
    EXPECT_TRUE(eventually([&] { return logs.contains(row.logLine); }));
    EXPECT_TRUE(eventually([&] { return runner->calls().size() == before + row.flushes; }));
    ASSERT_TRUE(eventually([&] { return openConnections() == 1; }));
    auto result = wellBehaved->flush();
    EXPECT_TRUE(result.ok) << result.error;
  }
  EXPECT_EQ(runner->calls().size(), 6u);
}

}  // namespace
}  // namespace fbf::testing
