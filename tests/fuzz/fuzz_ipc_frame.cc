// What any local client may write to the daemon's socket: any bytes through
// the frame reader, request decoding and the service's dispatch, over a
// real socket pair. However the stream is cut, no request gets more than
// one reply, no reply answers an id that was never asked, and the daemon
// ends the conversation once the client has.
//
// Input: the first byte picks the shape. Even: the rest is the raw stream.
// Odd: the rest is chunks [length, body...], each sent as one well-formed
// frame, so that the fuzzer reaches the requests themselves.
#include "assembly/fbf_strings.h"
#include "fbf_ipc.pb.h"
#include "fuzz_check.h"
#include "ipc/flusher_service.h"
#include "ipc/frame_channel.h"
#include "platform/logging.h"
#include "support/test_support.h"

#include <asio.hpp>
#include <poll.h>
#include <sys/socket.h>

#include <cstdint>
#include <cstdlib>
#include <map>
#include <memory>
#include <string>
#include <thread>

namespace {

class ImmediateRunner final : public fbf::FlushRunner {
 public:
  void flushAll(std::function<void()> completion) override { completion(); }
  void flushCustomFeedbackType(const std::string&, std::function<void()> completion) override { completion(); }
  std::optional<std::string> flushSessionEagerly(const std::filesystem::path& path,
                                                 std::function<void()> completion) override {
    if (path.filename().string().rfind("session.", 0) != 0) return "refused";
    completion();
    return std::nullopt;
  }
  fbf::ipc::StatusReply status() override { return {}; }
};

class Controller final : public fbf::InstalledAppControllerProtocol {
 public:
  void updateWhitelists(uint64_t, std::function<void()> completion) override {
    if (completion) completion();
  }
};

struct Fixture {
  Fixture() {
    env.installedAppControllerFactory = [](fbf::FBFAssembly&) { return std::make_unique<Controller>(); };
    assembly = &env.assembly();
    service = std::make_unique<fbf::FlusherService>(*assembly, std::make_shared<ImmediateRunner>());
    ioThread = std::thread([this] { io.run(); });
  }
  asio::io_context io;
  asio::executor_work_guard<asio::io_context::executor_type> guard{io.get_executor()};
  fbf::testing::TestEnvironment env{true};
  fbf::FBFAssembly* assembly = nullptr;
  std::unique_ptr<fbf::FlusherService> service;
  std::thread ioThread;
};

Fixture& fixture() {
  static auto* f = new Fixture;  // outlives every input; never torn down
  return *f;
}

// Request ids of the complete frames in what was sent, in order, up to the
// first frame the daemon must refuse; undecodable bodies count as id 0.
std::multiset<uint64_t> requestsIn(const std::string& stream, size_t* frames) {
  std::multiset<uint64_t> ids;
  *frames = 0;
  size_t pos = 0;
  while (pos + fbf::ipc::kFrameHeaderBytes <= stream.size()) {
    uint32_t length = fbf::ipc::decodeFrameHeader(reinterpret_cast<const uint8_t*>(stream.data() + pos));
    if (length > fbf::ipc::kMaxRequestFrameBytes) break;
    if (pos + fbf::ipc::kFrameHeaderBytes + length > stream.size()) break;
    fbf::ipc::Request request;
    bool ok = request.ParseFromArray(stream.data() + pos + fbf::ipc::kFrameHeaderBytes, static_cast<int>(length));
    ids.insert(ok ? request.id() : 0);
    ++*frames;
    pos += fbf::ipc::kFrameHeaderBytes + length;
    if (!ok) break;  // the daemon answers with id 0 and hangs up
  }
  return ids;
}

bool readAll(int fd, std::string& out) {
  char buf[65536];
  while (true) {
    pollfd p{fd, POLLIN, 0};
    // libFuzzer's timeout alarm interrupts poll, which no handler restarts.
    const int ready = ::poll(&p, 1, 10000);
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return false;  // the daemon never hung up
    ssize_t n = ::read(fd, buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return true;  // reset by the daemon: also an end
    if (n == 0) return true;
    out.append(buf, static_cast<size_t>(n));
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  fixture();
  fbf::fuzz::removeAtExit(fixture().env.temp.path());
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  std::string stream;
  if (data[0] & 1) {
    for (size_t i = 1; i < size;) {
      size_t length = data[i++];
      length = std::min(length, size - i);
      stream += fbf::ipc::encodeFrame(std::string_view(reinterpret_cast<const char*>(data + i), length));
      i += length;
    }
  } else {
    stream.assign(reinterpret_cast<const char*>(data + 1), size - 1);
  }

  auto& f = fixture();
  fbf::ipc::UnixSocket daemonEnd(f.io);
  fbf::ipc::UnixSocket clientEnd(f.io);
  asio::local::connect_pair(daemonEnd, clientEnd);
  int client = clientEnd.native_handle();
  f.service->accept(std::move(daemonEnd));

  // Requests are small; the socket buffer takes them whole, so the client
  // can write everything before reading.
  size_t sent = 0;
  while (sent < stream.size()) {
    ssize_t n = ::send(client, stream.data() + sent, stream.size() - sent, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;  // the daemon hung up early
    sent += static_cast<size_t>(n);
  }
  ::shutdown(client, SHUT_WR);
  std::string received;
  FUZZ_CHECK(readAll(client, received), "the daemon kept the connection after the client ended it");
  std::error_code ec;
  clientEnd.close(ec);

  size_t frames = 0;
  auto asked = requestsIn(stream.substr(0, sent), &frames);
  std::map<uint64_t, size_t> answered;
  size_t pos = 0, replies = 0;
  while (pos + fbf::ipc::kFrameHeaderBytes <= received.size()) {
    uint32_t length = fbf::ipc::decodeFrameHeader(reinterpret_cast<const uint8_t*>(received.data() + pos));
    FUZZ_CHECK(pos + fbf::ipc::kFrameHeaderBytes + length <= received.size(), "the daemon sent a cut frame");
    fbf::ipc::DaemonMessage message;
    FUZZ_CHECK(message.ParseFromArray(received.data() + pos + fbf::ipc::kFrameHeaderBytes, static_cast<int>(length)),
               "the daemon sent a frame that does not decode");
    pos += fbf::ipc::kFrameHeaderBytes + length;
    uint64_t id;
    if (message.has_reply()) {
      id = message.reply().id();
    } else if (message.has_statusreply()) {
      id = message.statusreply().id();
    } else {
      continue;  // tee payloads are not replies
    }
    ++replies;
    FUZZ_CHECK(++answered[id] <= asked.count(id), "id %llu answered %zu times, asked %zu times",
               static_cast<unsigned long long>(id), answered[id], asked.count(id));
  }
  FUZZ_CHECK(pos == received.size(), "trailing bytes after the last frame");
  FUZZ_CHECK(replies <= frames, "%zu replies to %zu frames", replies, frames);
  return 0;
}
