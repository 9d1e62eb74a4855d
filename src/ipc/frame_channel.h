// One end of a local IPC connection that carries whole messages.
//
// Every message travels as one frame: a 4-byte big-endian length followed by
// that many bytes. A frame whose announced length exceeds the reader's limit,
// or a peer that goes away in the middle of a frame, ends the connection; the
// frames before it have been delivered. Nothing here knows what the bytes
// mean.
//
// Threading. All socket work runs on a strand of the socket's executor, so the
// io_context may be run by any number of threads. `send` and `close` may be
// called from any thread. The frame and close handlers run on the strand; the
// close handler runs exactly once, after which no handler runs again and both
// are released (they may hold the channel's owner).
//
// Ownership. Always held by std::shared_ptr; pending socket operations keep
// the channel alive until the socket is closed.
#pragma once

#include <asio.hpp>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace fbf::ipc {

using UnixSocket = asio::local::stream_protocol::socket;

// What a client may send the daemon in one frame.
inline constexpr size_t kMaxRequestFrameBytes = size_t{1} << 20;
// What the daemon may send a client in one frame (tee payloads are large).
inline constexpr size_t kMaxDaemonFrameBytes = size_t{64} << 20;
inline constexpr size_t kFrameHeaderBytes = 4;

// The header announcing a body of `length` bytes.
std::string encodeFrameHeader(uint32_t length);
uint32_t decodeFrameHeader(const uint8_t header[kFrameHeaderBytes]);
// Header and body; the body must fit in 32 bits.
std::string encodeFrame(std::string_view body);

// The process id of the peer of a connected Unix socket (SO_PEERCRED); no value
// when the kernel does not tell.
std::optional<int> peerProcessId(UnixSocket& socket);

class FrameChannel : public std::enable_shared_from_this<FrameChannel> {
 public:
  enum class CloseReason {
    peerClosed,      // orderly end of stream between frames
    closedLocally,   // close() was called
    truncatedFrame,  // end of stream inside a frame
    oversizedFrame,  // a frame announced more than the incoming limit
    ioError,         // the socket failed
  };
  struct Closure {
    CloseReason reason;
    std::string detail;  // human-readable, for log lines
  };

  using FrameHandler = std::function<void(std::string body)>;
  using CloseHandler = std::function<void(const Closure&)>;
  // Why a frame will not reach the peer.
  using SendErrorHandler = std::function<void(const std::string& error)>;

  static std::shared_ptr<FrameChannel> make(UnixSocket socket, size_t maxIncomingFrame,
                                            size_t maxOutgoingFrame);
  ~FrameChannel();

  FrameChannel(const FrameChannel&) = delete;
  FrameChannel& operator=(const FrameChannel&) = delete;

  // Starts reading. Call once; frames are delivered in order.
  void start(FrameHandler onFrame, CloseHandler onClosed);

  // Queues `body` as one frame. Frames go out in the order of the calls. When
  // the body exceeds the outgoing limit it is not sent and the connection
  // stays up; when the channel is closed or the write fails, `onError` (if
  // any) is called on the strand.
  void send(std::string body, SendErrorHandler onError = nullptr);

  // Stops delivering incoming frames at once, refuses further sends, writes
  // what is already queued and then closes the socket (or at once when nothing
  // is queued). Idempotent. A peer that never reads keeps the socket until it
  // goes away.
  void close();

  // Bytes handed to `send` that have not been written yet: how far a peer
  // that does not read has fallen behind. Any thread.
  size_t pendingBytes() const { return pendingBytes_.load(); }

  // False once close() was called or the connection ended.
  bool isOpen() const { return open_.load(); }

  static std::string_view describe(CloseReason reason);

 private:
  struct Outgoing {
    std::string bytes;
    SendErrorHandler onError;
  };

  FrameChannel(UnixSocket socket, size_t maxIncomingFrame, size_t maxOutgoingFrame);
  void readHeader();
  void readBody(uint32_t length);
  void enqueue(Outgoing out);
  void writeNext();
  void finish(Closure closure);

  asio::strand<asio::any_io_executor> strand_;
  UnixSocket socket_;
  const size_t maxIncoming_;
  const size_t maxOutgoing_;
  std::atomic<bool> open_{true};
  std::atomic<size_t> pendingBytes_{0};

  // Strand only.
  FrameHandler onFrame_;
  CloseHandler onClosed_;
  uint8_t header_[kFrameHeaderBytes] = {};
  std::string body_;
  std::deque<Outgoing> queue_;
  bool writing_ = false;
  bool closing_ = false;
  bool finished_ = false;
};

}  // namespace fbf::ipc
