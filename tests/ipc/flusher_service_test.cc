// The daemon's service over a real socket: every request kind answered, the
// listener slots and their clearing when a connection goes away, and peers
// that break the framing without disturbing anyone else.

#include "ipc/control_client.h"
#include "ipc/frame_channel.h"
#include "ipc_fixture.h"

#include "corevireon.pb.h"

#include <unistd.h>

namespace fbf::testing {
namespace {

ipc::Request flushRequest() {
  ipc::Request r;
  r.mutable_flush();
  return r;
}

// ---------------------------------------------------------------------------

class AClientAskingTheDaemon : public IpcFixture {};

TEST_F(AClientAskingTheDaemon, GetsAFullFlushAnsweredWhenTheFlushHasFinished) {
  runner->holdCompletions(true);
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  auto outcome = std::async(std::launch::async, [&] { return client->flush(); });

  ASSERT_TRUE(eventually([&] { return runner->heldCount() == 1; }));
  // Nothing can answer before the flush completes.
  EXPECT_NE(outcome.wait_for(std::chrono::seconds(0)), std::future_status::ready);
  assembly->workloop().sync([&] { runner->releaseAll(); });

  auto result = outcome.get();
  EXPECT_TRUE(result.ok) << result.error;
  EXPECT_EQ(runner->calls(), std::vector<std::string>{"flushAll"});
  EXPECT_TRUE(logs.contains("Service created new flusher"));
}

TEST_F(AClientAskingTheDaemon, FlushesOneCustomFeedbackType) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  auto result = client->flushCustomFeedbackType("UserReport");
  EXPECT_TRUE(result.ok) << result.error;
  EXPECT_EQ(runner->calls(), std::vector<std::string>{"flushCustomFeedbackType UserReport"});
  EXPECT_EQ(logs.count("Service created new flusher"), 1u);
}

TEST_F(AClientAskingTheDaemon, FlushesOneSessionEagerly) {
  auto path = env.cacheDir() / "session.42.0A1B.closed";
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  auto result = client->flushSessionEagerly(path);
  EXPECT_TRUE(result.ok) << result.error;
  EXPECT_EQ(runner->calls(), std::vector<std::string>{"flushSessionEagerly " + path.string()});
  EXPECT_TRUE(logs.contains("Service created new flusher for eager flush of " + path.string()));
}

TEST_F(AClientAskingTheDaemon, HearsWhyAnEagerFlushOfAPathOutsideTheCacheIsRefused) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  auto outside = client->flushSessionEagerly(env.temp.path() / "session.42.0A1B.closed");
  EXPECT_FALSE(outside.ok);
  EXPECT_NE(outside.error.find("outside the cache directory"), std::string::npos) << outside.error;

  auto notASession = client->flushSessionEagerly(env.cacheDir() / "bag.plist");
  EXPECT_FALSE(notASession.ok);
  EXPECT_NE(notASession.error.find("not a session file name"), std::string::npos)
      << notASession.error;

  EXPECT_TRUE(runner->calls().empty());
  // The connection is still good for the next request.
  EXPECT_TRUE(client->flush().ok);
}

TEST_F(AClientAskingTheDaemon, UpdatesTheWhitelistsAndGetsTheStoredSignature) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  auto result = client->updateWhitelists(2);
  EXPECT_TRUE(result.ok) << result.error;
  EXPECT_EQ(result.whitelistSignature, "signature-2");
  assembly->workloop().sync([&] { EXPECT_EQ(controller->conditions, std::vector<uint64_t>{2}); });
}

TEST_F(AClientAskingTheDaemon, ReadsTheStatusWithListenersVersionAndPid) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  std::string error;
  auto status = client->status(&error);
  ASSERT_TRUE(status) << error;
  ASSERT_EQ(status->sessions_size(), 1);
  EXPECT_EQ(status->sessions(0).name(), "closed");
  EXPECT_EQ(status->sessions(0).files(), 3u);
  ASSERT_EQ(status->customfeedback_size(), 1);
  EXPECT_EQ(status->pid(), getpid());
  EXPECT_NE(status->version().find("vireon-fbf/"), std::string::npos);
  EXPECT_FALSE(status->uploadslistener());

  auto tee = connectClient();
  tee->resume();
  ipc::Request subscribe;
  subscribe.mutable_teeuploads();
  ASSERT_TRUE(ask(*tee, subscribe).message);
  status = client->status(&error);
  ASSERT_TRUE(status) << error;
  EXPECT_TRUE(status->uploadslistener());
  EXPECT_FALSE(status->cohortslistener());
}

TEST_F(AClientAskingTheDaemon, IsToldWhenTheRequestCarriesNoOperationAndCanGoOn) {
  auto client = connectClient();
  client->resume();
  auto answer = ask(*client, ipc::Request());
  ASSERT_TRUE(answer.message) << answer.error;
  ASSERT_TRUE(answer.message->has_reply());
  EXPECT_FALSE(answer.message->reply().ok());
  EXPECT_EQ(answer.message->reply().error(), "unknown or missing operation");

  answer = ask(*client, flushRequest());
  ASSERT_TRUE(answer.message) << answer.error;
  EXPECT_TRUE(answer.message->reply().ok());
}

class ADaemonWithoutWhitelistMaintenance : public IpcFixture {
 protected:
  bool withWhitelistController() const override { return false; }
};

TEST_F(ADaemonWithoutWhitelistMaintenance, RefusesAWhitelistUpdateWithAReason) {
  auto client = ipc::ControlClient::connect(socketPath());
  ASSERT_TRUE(client);
  auto result = client->updateWhitelists(0);
  EXPECT_FALSE(result.ok);
  EXPECT_EQ(result.error, "whitelist maintenance unavailable");
}

// ---------------------------------------------------------------------------

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
    if (uploads) {
      ipc::Request r;
      r.mutable_teeuploads();
      auto answer = ask(*listener->connection, r);
      EXPECT_TRUE(answer.message && answer.message->reply().ok()) << answer.error;
    }
    if (cohorts) {
      ipc::Request r;
      r.mutable_teecohortsfeedback();
      auto answer = ask(*listener->connection, r);
      EXPECT_TRUE(answer.message && answer.message->reply().ok()) << answer.error;
    }
    return listener;
  }

  void uploadFromWorkQueue(const std::string& data, const std::string& format) {
    assembly->workloop().sync([&] {
      if (auto l = assembly->uploadListener()) l->willUploadData(data, format);
    });
  }
};

TEST_F(ListenersOfUploadsAndCohorts, ASubscriberReceivesEachPayloadTheWorkQueueAnnounces) {
  auto listener = subscribe(true, false);
  EXPECT_TRUE(logs.contains("setting up a new sending stream listener"));
  uploadFromWorkQueue("first payload", "FeedbackV2");
  uploadFromWorkQueue(std::string("\0\1\2", 3), "FeedbackV2PB");

  ASSERT_TRUE(eventually([&] { return listener->count() == 2; }));
  std::lock_guard l(listener->m);
  ASSERT_TRUE(listener->received[0].has_willuploaddata());
  EXPECT_EQ(listener->received[0].willuploaddata().data(), "first payload");
  EXPECT_EQ(listener->received[0].willuploaddata().format(), "FeedbackV2");
  EXPECT_EQ(listener->received[1].willuploaddata().data(), std::string("\0\1\2", 3));
}

TEST_F(ListenersOfUploadsAndCohorts, ACohortsSubscriberReceivesGeneratedFeedback) {
  auto listener = subscribe(false, true);
  EXPECT_TRUE(logs.contains("setting up a new cohort listnener"));
  assembly->workloop().sync(
      [&] { assembly->cohortsListener()->willGenerateCohortFeebacks("envelope bytes"); });
  ASSERT_TRUE(eventually([&] { return listener->count() == 1; }));
  std::lock_guard l(listener->m);
  ASSERT_TRUE(listener->received[0].has_willgeneratecohortfeebacks());
  EXPECT_EQ(listener->received[0].willgeneratecohortfeebacks().data(), "envelope bytes");
}

TEST_F(ListenersOfUploadsAndCohorts,
       TheSecondSubscriberReplacesTheFirstAndTheFirstLeavingClearsTheSlot) {
  auto first = subscribe(true, false);
  auto second = subscribe(true, false);
  uploadFromWorkQueue("only for the second", "FeedbackV2");
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

TEST_F(ListenersOfUploadsAndCohorts, AConnectionHoldingBothClearsUploadsThenCohorts) {
  auto both = subscribe(true, true);
  ASSERT_NE(uploadListener(), nullptr);
  ASSERT_NE(cohortsListener(), nullptr);

  both->connection->invalidate();
  ASSERT_TRUE(eventually([&] { return openConnections() == 0; }));
  EXPECT_EQ(uploadListener(), nullptr);
  EXPECT_EQ(cohortsListener(), nullptr);

  auto lines = logs.lines();
  auto at = [&](const std::string& text) {
    return std::find_if(lines.begin(), lines.end(),
                        [&](const std::string& l) { return l.find(text) != l.npos; });
  };
  auto invalidating = at("invalidating connection from PID " + std::to_string(getpid()));
  auto uploads = at("clearing the sending stream listener");
  auto cohorts = at("clearing the cohorts listener");
  ASSERT_NE(invalidating, lines.end());
  ASSERT_NE(uploads, lines.end());
  ASSERT_NE(cohorts, lines.end());
  EXPECT_LT(invalidating, uploads);
  EXPECT_LT(uploads, cohorts);
}

TEST_F(ListenersOfUploadsAndCohorts, APayloadForASubscriberThatLeftIsLoggedAsAProxyError) {
  auto listener = subscribe(true, false);
  auto proxy = uploadListener();
  listener->connection->invalidate();
  ASSERT_TRUE(eventually([&] { return openConnections() == 0; }));
  // A flush that took the proxy before the slot was cleared still calls it.
  assembly->workloop().sync([&] { proxy->willUploadData("late", "FeedbackV2"); });
  ASSERT_TRUE(eventually([&] { return logs.contains("remote proxy error: "); }));
}

// ---------------------------------------------------------------------------

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
    if (ec) return std::nullopt;
    return body;
  }

 private:
  asio::io_context io_;
  asio::local::stream_protocol::socket socket_;
};

class PeersBreakingTheFraming : public IpcFixture {
 protected:
  void SetUp() override {
    IpcFixture::SetUp();
    wellBehaved = ipc::ControlClient::connect(socketPath());
    ASSERT_TRUE(wellBehaved);
    ASSERT_TRUE(wellBehaved->flush().ok);
  }
  void TearDown() override {
    wellBehaved.reset();
    IpcFixture::TearDown();
  }

  // The other client is still served, and only the broken connection went.
  void expectOthersStillServed() {
    ASSERT_TRUE(eventually([&] { return openConnections() == 1; }));
    auto result = wellBehaved->flush();
    EXPECT_TRUE(result.ok) << result.error;
  }

  std::unique_ptr<ipc::ControlClient> wellBehaved;
};

TEST_F(PeersBreakingTheFraming, AFrameThatDoesNotDecodeIsAnsweredWithIdZeroAndEndsThatConnection) {
  RawPeer peer(socketPath());
  peer.write(ipc::encodeFrame(std::string("\xff\xff\xff\xff\xff\xff", 6)));

  auto frame = peer.readFrame();
  ASSERT_TRUE(frame);
  ipc::DaemonMessage message;
  ASSERT_TRUE(message.ParseFromString(*frame));
  ASSERT_TRUE(message.has_reply());
  EXPECT_EQ(message.reply().id(), 0u);
  EXPECT_FALSE(message.reply().ok());
  EXPECT_FALSE(peer.readFrame()) << "the connection should have been closed";
  EXPECT_TRUE(logs.contains("does not decode"));
  expectOthersStillServed();
}

TEST_F(PeersBreakingTheFraming, AnOversizedLengthEndsThatConnectionWithoutReadingIt) {
  RawPeer peer(socketPath());
  peer.write(ipc::encodeFrameHeader(static_cast<uint32_t>(ipc::kMaxRequestFrameBytes + 1)));
  EXPECT_FALSE(peer.readFrame());
  EXPECT_TRUE(eventually([&] { return logs.contains("exceeds the limit"); }));
  expectOthersStillServed();
}

TEST_F(PeersBreakingTheFraming, APeerLeavingInTheMiddleOfAFrameEndsOnlyItsConnection) {
  {
    RawPeer peer(socketPath());
    ASSERT_TRUE(eventually([&] { return openConnections() == 2; }));
    peer.write(ipc::encodeFrameHeader(100) + std::string(10, 'x'));
  }
  ASSERT_TRUE(eventually([&] { return logs.contains("went away after 10 of 100 bytes"); }));
  expectOthersStillServed();
  EXPECT_EQ(runner->calls().size(), 2u);
}

TEST_F(PeersBreakingTheFraming, RequestsBeforeABrokenFrameAreStillServed) {
  RawPeer peer(socketPath());
  ipc::Request request = flushRequest();
  request.set_id(7);
  peer.write(ipc::encodeFrame(request.SerializeAsString()) + ipc::encodeFrameHeader(50));
  peer.shutdownSending();
  ASSERT_TRUE(eventually([&] { return runner->calls().size() == 2; }));
  expectOthersStillServed();
}

// ---------------------------------------------------------------------------

TEST(FrameHeader, IsTheLengthBigEndian) {
  EXPECT_EQ(ipc::encodeFrameHeader(0x01020304u), std::string("\x01\x02\x03\x04", 4));
  const uint8_t bytes[4] = {0xfe, 0x00, 0x00, 0x10};
  EXPECT_EQ(ipc::decodeFrameHeader(bytes), 0xfe000010u);
  EXPECT_EQ(ipc::encodeFrame("ab"), std::string("\0\0\0\x02"
                                                "ab",
                                                6));
}

}  // namespace
}  // namespace fbf::testing
