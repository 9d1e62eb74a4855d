// The client object other processes use to ask the daemon for one thing: an
// eager flush of one session file, or a whitelist update.
//
// Each client serves one request on one connection: when the daemon has
// answered, the caller's completion runs (on the connection's thread) and the
// connection is then closed from the private queue "vireon-fbf.invalidation".
// A second request on the same client gets no answer. If the connection fails
// before the answer, the failure is logged and the completion never runs.
// Logs under the sibling daemon's subsystem "vireond".
//
// Thread-safety: requests may be made from any thread. Destroying the client
// closes its connection.
#pragma once

#include "ipc/daemon_connection.h"
#include "platform/task_queue.h"

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>

namespace fbf {

// The values the installed-app controller interprets.
enum class FBFUpdateWhitelistCondition : uint64_t { now = 0, soon = 1, ifStale = 2 };

class FlusherClient {
 public:
  // `connection` is resumed here. A null connection stands for a daemon that
  // does not speak the protocol: every request is then logged and dropped.
  explicit FlusherClient(std::shared_ptr<ipc::DaemonConnection> connection);
  ~FlusherClient();

  FlusherClient(const FlusherClient&) = delete;
  FlusherClient& operator=(const FlusherClient&) = delete;

  // `completion` runs after the daemon has finished with the file.
  void flushSessionEagerly(const std::filesystem::path& url,
                           std::function<void()> completion = nullptr);
  // `completion` runs once the daemon has accepted the request.
  void updateWhitelists(uint64_t condition, std::function<void()> completion = nullptr);

 private:
  void request(ipc::Request request, const char* finishedMessage, std::function<void()> completion);

  std::shared_ptr<ipc::DaemonConnection> connection_;
  std::shared_ptr<TaskQueue> invalidationQueue_;
};

}  // namespace fbf
