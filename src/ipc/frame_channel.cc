#include "ipc/frame_channel.h"

#include <sys/socket.h>

#include <algorithm>
#include <limits>

namespace fbf::ipc {

std::string encodeFrameHeader(uint32_t length) {
  std::string out(kFrameHeaderBytes, '\0');
  out[0] = static_cast<char>((length >> 24) & 0xff);
  out[1] = static_cast<char>((length >> 16) & 0xff);
  out[2] = static_cast<char>((length >> 8) & 0xff);
  out[3] = static_cast<char>(length & 0xff);
  return out;
}

uint32_t decodeFrameHeader(const uint8_t header[kFrameHeaderBytes]) {
  return (uint32_t{header[0]} << 24) | (uint32_t{header[1]} << 16) | (uint32_t{header[2]} << 8) |
         uint32_t{header[3]};
}

std::string encodeFrame(std::string_view body) {
  std::string out = encodeFrameHeader(static_cast<uint32_t>(body.size()));
  out.append(body);
  return out;
}

std::optional<int> peerProcessId(UnixSocket& socket) {
  struct ucred cred {};
  socklen_t len = sizeof(cred);
  if (getsockopt(socket.native_handle(), SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0 ||
      cred.pid <= 0) {
    return std::nullopt;
  }
  return static_cast<int>(cred.pid);
}

std::string_view FrameChannel::describe(CloseReason reason) {
  switch (reason) {
    case CloseReason::peerClosed:
      return "peer closed the connection";
    case CloseReason::closedLocally:
      return "connection closed";
    case CloseReason::truncatedFrame:
      return "peer went away in the middle of a frame";
    case CloseReason::oversizedFrame:
      return "frame exceeds the size limit";
    case CloseReason::ioError:
      return "socket error";
  }
  return "unknown";
}

std::shared_ptr<FrameChannel> FrameChannel::make(UnixSocket socket, size_t maxIncomingFrame,
                                                 size_t maxOutgoingFrame) {
  return std::shared_ptr<FrameChannel>(
      new FrameChannel(std::move(socket), maxIncomingFrame, maxOutgoingFrame));
}

FrameChannel::FrameChannel(UnixSocket socket, size_t maxIncomingFrame, size_t maxOutgoingFrame)
    : strand_(asio::make_strand(socket.get_executor())),
      socket_(std::move(socket)),
      maxIncoming_(std::min<size_t>(maxIncomingFrame, std::numeric_limits<uint32_t>::max())),
      maxOutgoing_(std::min<size_t>(maxOutgoingFrame, std::numeric_limits<uint32_t>::max())) {}

FrameChannel::~FrameChannel() {
  std::error_code ec;
  socket_.close(ec);
}

void FrameChannel::start(FrameHandler onFrame, CloseHandler onClosed) {
  asio::dispatch(strand_, [self = shared_from_this(), onFrame = std::move(onFrame),
                           onClosed = std::move(onClosed)]() mutable {
    if (self->finished_) {
      // Closed before it started: still report the end exactly once.
      if (onClosed)
        onClosed({CloseReason::closedLocally, std::string(describe(CloseReason::closedLocally))});
      return;
    }
    self->onFrame_ = std::move(onFrame);
    self->onClosed_ = std::move(onClosed);
    self->readHeader();
  });
}

void FrameChannel::readHeader() {
  asio::async_read(
      socket_, asio::buffer(header_, kFrameHeaderBytes),
      asio::bind_executor(strand_, [self = shared_from_this()](const std::error_code& ec,
                                                               size_t n) {
        if (self->finished_) return;
        if (ec) {
          if ((ec == asio::error::eof || ec == asio::error::connection_reset) && n == 0) {
            self->finish({CloseReason::peerClosed, std::string(describe(CloseReason::peerClosed))});
          } else if (ec == asio::error::eof) {
            self->finish({CloseReason::truncatedFrame,
                          "peer went away after " + std::to_string(n) + " of 4 header bytes"});
          } else {
            self->finish({CloseReason::ioError, ec.message()});
          }
          return;
        }
        uint32_t length = decodeFrameHeader(self->header_);
        if (length > self->maxIncoming_) {
          self->finish({CloseReason::oversizedFrame,
                        "frame of " + std::to_string(length) + " bytes exceeds the limit of " +
                            std::to_string(self->maxIncoming_) + " bytes"});
          return;
        }
        self->readBody(length);
      }));
}

void FrameChannel::readBody(uint32_t length) {
  body_.assign(length, '\0');
  asio::async_read(socket_, asio::buffer(body_.data(), body_.size()),
                   asio::bind_executor(strand_, [self = shared_from_this(), length](
                                                    const std::error_code& ec, size_t n) {
                     if (self->finished_) return;
                     if (ec) {
                       if (ec == asio::error::eof || ec == asio::error::connection_reset) {
                         self->finish({CloseReason::truncatedFrame,
                                       "peer went away after " + std::to_string(n) + " of " +
                                           std::to_string(length) + " bytes"});
                       } else {
                         self->finish({CloseReason::ioError, ec.message()});
                       }
                       return;
                     }
                     std::string body = std::move(self->body_);
                     self->body_.clear();
                     // Once closing, the rest of the stream is read only to notice the
                     // peer going away; it is not acted on.
                     if (!self->closing_ && self->onFrame_) self->onFrame_(std::move(body));
                     if (!self->finished_) self->readHeader();
                   }));
}

void FrameChannel::send(std::string body, SendErrorHandler onError) {
  if (body.size() > maxOutgoing_) {
    std::string error = "message of " + std::to_string(body.size()) +
                        " bytes exceeds the frame limit of " + std::to_string(maxOutgoing_) +
                        " bytes";
    if (onError) asio::post(strand_, [onError = std::move(onError), error] { onError(error); });
    return;
  }
  Outgoing out{encodeFrameHeader(static_cast<uint32_t>(body.size())), std::move(onError)};
  out.bytes.append(body);
  pendingBytes_ += out.bytes.size();
  asio::post(strand_, [self = shared_from_this(), out = std::move(out)]() mutable {
    self->enqueue(std::move(out));
  });
}

void FrameChannel::enqueue(Outgoing out) {
  if (finished_ || closing_) {
    pendingBytes_ -= out.bytes.size();
    if (out.onError) out.onError("connection invalidated");
    return;
  }
  queue_.push_back(std::move(out));
  if (!writing_) writeNext();
}

void FrameChannel::writeNext() {
  if (queue_.empty()) {
    writing_ = false;
    if (closing_)
      finish({CloseReason::closedLocally, std::string(describe(CloseReason::closedLocally))});
    return;
  }
  writing_ = true;
  asio::async_write(
      socket_, asio::buffer(queue_.front().bytes),
      asio::bind_executor(strand_, [self = shared_from_this()](const std::error_code& ec, size_t) {
        if (self->finished_) return;
        if (ec) {
          Outgoing failed = std::move(self->queue_.front());
          self->queue_.pop_front();
          self->pendingBytes_ -= failed.bytes.size();
          if (failed.onError) failed.onError(ec.message());
          self->finish({CloseReason::ioError, ec.message()});
          return;
        }
        self->pendingBytes_ -= self->queue_.front().bytes.size();
        self->queue_.pop_front();
        self->writeNext();
      }));
}

void FrameChannel::close() {
  open_.store(false);
  // Posted, never run inline, so that frames sent before the call still go
  // out even when it is made on the strand.
  asio::post(strand_, [self = shared_from_this()] {
    if (self->finished_ || self->closing_) return;
    self->closing_ = true;
    if (!self->writing_) {
      self->finish({CloseReason::closedLocally, std::string(describe(CloseReason::closedLocally))});
    }
  });
}

void FrameChannel::finish(Closure closure) {
  if (finished_) return;
  finished_ = true;
  open_.store(false);
  std::error_code ignored;
  socket_.shutdown(asio::socket_base::shutdown_both, ignored);
  socket_.close(ignored);
  auto pending = std::move(queue_);
  queue_.clear();
  writing_ = false;
  // The write in flight (if any) reported its own error before we got here,
  // or was aborted by the close above and is reported with the rest.
  for (auto& out : pending) {
    if (out.onError) out.onError("connection closed before the message was sent");
  }
  auto onClosed = std::move(onClosed_);
  onClosed_ = nullptr;
  onFrame_ = nullptr;
  if (onClosed) onClosed(closure);
}

}  // namespace fbf::ipc
