#include "ipc/daemon_connection.h"

#include "ipc/frame_channel.h"

#include <asio.hpp>

#include <vector>

namespace fbf::ipc {

struct DaemonConnection::Runtime {
  asio::io_context io{1};
  asio::executor_work_guard<asio::io_context::executor_type> guard{io.get_executor()};
};

std::shared_ptr<DaemonConnection> DaemonConnection::connect(const std::filesystem::path& socketPath,
                                                            std::string* error) {
  auto runtime = std::make_shared<Runtime>();
  UnixSocket socket(runtime->io);
  std::error_code ec;
  try {
    socket.connect(asio::local::stream_protocol::endpoint(socketPath.string()), ec);
  } catch (const std::exception& e) {  // a path too long for a socket address
    if (error) *error = e.what();
    return nullptr;
  }
  if (ec) {
    if (error) *error = ec.message();
    return nullptr;
  }
  auto channel = FrameChannel::make(std::move(socket), kMaxDaemonFrameBytes, kMaxRequestFrameBytes);
  return std::shared_ptr<DaemonConnection>(
      new DaemonConnection(std::move(runtime), std::move(channel)));
}

DaemonConnection::DaemonConnection(std::shared_ptr<Runtime> runtime,
                                   std::shared_ptr<FrameChannel> channel)
    : runtime_(std::move(runtime)), channel_(std::move(channel)) {
  // The thread holds the runtime itself, so that it may outlive this object
  // when the last reference is dropped on the thread.
  thread_ = std::thread([runtime = runtime_] { runtime->io.run(); });
}

DaemonConnection::~DaemonConnection() {
  channel_->close();
  runtime_->guard.reset();
  runtime_->io.stop();
  if (thread_.get_id() == std::this_thread::get_id()) {
    thread_.detach();
  } else {
    thread_.join();
  }
}

void DaemonConnection::setMessageHandler(MessageHandler onMessage) {
  std::lock_guard lock(mutex_);
  onMessage_ = std::move(onMessage);
}

void DaemonConnection::setEndHandler(ErrorHandler onEnded) {
  std::lock_guard lock(mutex_);
  onEnded_ = std::move(onEnded);
}

void DaemonConnection::resume() {
  std::weak_ptr<DaemonConnection> weak = weak_from_this();
  channel_->start(
      [weak](std::string body) {
        if (auto self = weak.lock()) self->handleFrame(body);
      },
      [weak](const FrameChannel::Closure& closure) {
        auto self = weak.lock();
        if (!self) return;
        std::string reason;
        {
          std::lock_guard lock(self->mutex_);
          reason = self->endReason_;
        }
        if (reason.empty()) {
          reason = closure.reason == FrameChannel::CloseReason::closedLocally
                       ? std::string("connection invalidated")
                       : closure.detail;
        }
        self->handleEnd(reason);
      });
}

uint64_t DaemonConnection::send(Request request, ReplyHandler onReply, ErrorHandler onError) {
  uint64_t id = 0;
  {
    std::lock_guard lock(mutex_);
    id = nextId_++;
    if (!ended_ && channel_->isOpen()) {
      pending_[id] = Pending{std::move(onReply), std::move(onError)};
      onError = nullptr;
    }
  }
  if (onError) {
    // Already closed: the answer is known, but is still given on the
    // connection's thread like every other.
    asio::post(runtime_->io, [onError = std::move(onError)] { onError("connection invalidated"); });
    return id;
  }
  request.set_id(id);
  std::string bytes;
  request.SerializeToString(&bytes);
  std::weak_ptr<DaemonConnection> weak = weak_from_this();
  channel_->send(std::move(bytes), [weak, id](const std::string& error) {
    auto self = weak.lock();
    if (!self) return;
    ErrorHandler handler;
    {
      std::lock_guard lock(self->mutex_);
      auto it = self->pending_.find(id);
      if (it == self->pending_.end()) return;
      handler = std::move(it->second.onError);
      self->pending_.erase(it);
    }
    if (handler) handler(error);
  });
  return id;
}

void DaemonConnection::invalidate() {
  {
    std::lock_guard lock(mutex_);
    if (endReason_.empty()) endReason_ = "connection invalidated";
  }
  channel_->close();
}

bool DaemonConnection::isValid() const { return channel_->isOpen(); }

void DaemonConnection::handleFrame(const std::string& body) {
  DaemonMessage message;
  if (!message.ParseFromString(body)) {
    {
      std::lock_guard lock(mutex_);
      if (endReason_.empty()) endReason_ = "the daemon sent a message that does not decode";
    }
    channel_->close();
    return;
  }
  uint64_t id = 0;
  switch (message.kind_case()) {
    case DaemonMessage::kReply:
      id = message.reply().id();
      break;
    case DaemonMessage::kStatusReply:
      id = message.statusreply().id();
      break;
    case DaemonMessage::kWillUploadData:
    case DaemonMessage::kWillGenerateCohortFeebacks: {
      MessageHandler handler;
      {
        std::lock_guard lock(mutex_);
        handler = onMessage_;
      }
      if (handler) handler(message);
      return;
    }
    case DaemonMessage::KIND_NOT_SET:
      return;  // something a newer daemon sends; nothing to do with it
  }
  ReplyHandler handler;
  {
    std::lock_guard lock(mutex_);
    auto it = pending_.find(id);
    if (it == pending_.end())
      return;  // id 0 (a request the daemon could not read) or no longer awaited
    handler = std::move(it->second.onReply);
    pending_.erase(it);
  }
  if (handler) handler(message);
}

void DaemonConnection::handleEnd(const std::string& reason) {
  std::map<uint64_t, Pending> pending;
  ErrorHandler onEnded;
  {
    std::lock_guard lock(mutex_);
    if (ended_) return;
    ended_ = true;
    pending.swap(pending_);
    onEnded = std::move(onEnded_);
    onEnded_ = nullptr;
    onMessage_ = nullptr;
  }
  for (auto& [id, p] : pending) {
    if (p.onError) p.onError(reason);
  }
  if (onEnded) onEnded(reason);
}

}  // namespace fbf::ipc
