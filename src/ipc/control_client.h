// A synchronous client of the daemon for command-line tools and scripts: each
// call sends one request and blocks until the daemon has answered (for a
// flush: until the flush has finished) or the connection has ended.
//
// One client per thread; the calls are not meant to run concurrently.
#pragma once

#include "ipc/daemon_connection.h"

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

namespace fbf::ipc {

struct ControlOutcome {
  bool ok = false;
  // Why not, when !ok: the daemon's refusal or the connection's end.
  std::string error;
  // Answering updateWhitelists: the signature stored afterwards.
  std::optional<std::string> whitelistSignature;
};

class ControlClient {
 public:
  // No value, with `error` set, when the daemon's socket does not accept.
  static std::unique_ptr<ControlClient> connect(const std::filesystem::path& socketPath,
                                                std::string* error = nullptr);
  ~ControlClient();

  ControlOutcome flush();
  ControlOutcome flushCustomFeedbackType(const std::string& type);
  ControlOutcome flushSessionEagerly(const std::filesystem::path& path);
  ControlOutcome updateWhitelists(uint64_t condition);
  // No value, with `error` set, when the daemon does not answer.
  std::optional<StatusReply> status(std::string* error = nullptr);

  enum class TeeKind { uploads, cohorts };
  // Subscribes, calls `onSubscribed`, then hands every WillUploadData or
  // WillGenerateCohortFeebacks message to `onMessage` on the calling thread
  // until it returns false (outcome ok) or the connection ends (outcome not
  // ok, with the reason).
  ControlOutcome tee(TeeKind kind, const std::function<void()>& onSubscribed,
                     const std::function<bool(const DaemonMessage&)>& onMessage);

 private:
  explicit ControlClient(std::shared_ptr<DaemonConnection> connection);
  // The answer, or why none came.
  std::optional<DaemonMessage> call(Request request, std::string* error);
  ControlOutcome callForReply(Request request);

  std::shared_ptr<DaemonConnection> connection_;

  // Unasked messages, handed from the connection's thread to the caller's.
  struct Inbox {
    std::mutex mutex;
    std::condition_variable changed;
    std::deque<DaemonMessage> messages;
    std::optional<std::string> ended;
  };
  std::shared_ptr<Inbox> inbox_;
};

}  // namespace fbf::ipc
