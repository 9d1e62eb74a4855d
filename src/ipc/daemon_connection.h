// A client's connection to the daemon's IPC socket.
//
// Owns a private I/O thread on which replies, daemon messages and error
// handlers run. Requests may be sent from any thread; each gets an id of its
// own and exactly one outcome: its reply handler, or its error handler when
// the connection ends first (including by `invalidate`). After
// `invalidate` nothing more arrives.
//
// Held by std::shared_ptr. Dropping the last reference invalidates the
// connection; it may be dropped from inside one of its own handlers.
#pragma once

#include "fbf_ipc.pb.h"

#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

namespace fbf::ipc {

class FrameChannel;

class DaemonConnection : public std::enable_shared_from_this<DaemonConnection> {
 public:
  using ReplyHandler = std::function<void(const DaemonMessage&)>;
  using ErrorHandler = std::function<void(const std::string& error)>;
  using MessageHandler = std::function<void(const DaemonMessage&)>;

  // Connects to the socket at `socketPath`. No value, with `error` set to the
  // system's reason, when nothing accepts there.
  static std::shared_ptr<DaemonConnection> connect(const std::filesystem::path& socketPath,
                                                   std::string* error = nullptr);
  ~DaemonConnection();

  DaemonConnection(const DaemonConnection&) = delete;
  DaemonConnection& operator=(const DaemonConnection&) = delete;

  // Handlers, set before `resume`. `onMessage` receives what the daemon sends
  // unasked (willUploadData, willGenerateCohortFeebacks); `onEnded` is called
  // once when the connection ends for any reason, with that reason.
  void setMessageHandler(MessageHandler onMessage);
  void setEndHandler(ErrorHandler onEnded);

  // Starts receiving. Requests sent before are queued and go out in order.
  void resume();

  // Sends `request` with a fresh id, which is returned. `onReply` receives the
  // Reply or StatusReply that answers it.
  uint64_t send(Request request, ReplyHandler onReply, ErrorHandler onError = nullptr);

  // Closes the connection. Pending requests get their error handler with
  // "connection invalidated". Idempotent.
  void invalidate();
  bool isValid() const;

 private:
  struct Runtime;
  DaemonConnection(std::shared_ptr<Runtime> runtime, std::shared_ptr<FrameChannel> channel);
  void handleFrame(const std::string& body);
  void handleEnd(const std::string& reason);

  std::shared_ptr<Runtime> runtime_;
  std::thread thread_;
  std::shared_ptr<FrameChannel> channel_;

  std::mutex mutex_;
  uint64_t nextId_ = 1;
  struct Pending {
    ReplyHandler onReply;
    ErrorHandler onError;
  };
  std::map<uint64_t, Pending> pending_;
  bool ended_ = false;
  std::string endReason_;
  MessageHandler onMessage_;
  ErrorHandler onEnded_;
};

}  // namespace fbf::ipc
