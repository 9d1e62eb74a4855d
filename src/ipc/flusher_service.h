// The daemon's side of the local IPC: the service that accepts client
// connections and the per-connection object that serves their requests.
//
// `FlusherService` is owned by the daemon's set-up and lives as long as the
// listener. Each accepted socket becomes a `FlusherConnection`, kept in
// `openConnections` until the connection ends. Requests arrive on the I/O
// thread of the socket and are served on the assembly's work queue, which is
// the only place `openConnections`, the listener slots and the listener flags
// are touched. Every connection is accepted; there is no check of the peer's
// identity or rights beyond the socket's owner-only permissions.
//
// Wire protocol: fbf_ipc.proto over ipc::FrameChannel. A request that does not
// decode is answered with id 0 and ends its connection; an oversized or
// truncated frame ends its connection; other connections are not affected.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "ipc/flush_runner.h"
#include "ipc/frame_channel.h"

#include "fbf_ipc.pb.h"

#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace fbf {

// Serves one client. Made by FlusherService; held by the service's
// `openConnections`, by its own invalidation handler and by requests in
// flight. Destroying it closes the connection.
class FlusherConnection : public std::enable_shared_from_this<FlusherConnection> {
 public:
  // `serviceAlive` expires when the service is destroyed; requests arriving
  // after that are dropped.
  FlusherConnection(FBFAssemblyProtocol& assembly, std::shared_ptr<FlushRunner> runner,
                    std::shared_ptr<ipc::FrameChannel> channel, int processIdentifier,
                    std::weak_ptr<void> serviceAlive);
  ~FlusherConnection();

  FlusherConnection(const FlusherConnection&) = delete;
  FlusherConnection& operator=(const FlusherConnection&) = delete;

  // Starts reading requests. `onInvalidated` runs once, on the socket's
  // strand, when the connection has ended for whatever reason.
  void resume(std::function<void()> onInvalidated);

  // The operations of the daemon protocol. Work queue only; each completion
  // is called once, on the work queue, unless the operation is refused.
  void flush(std::function<void()> completion);
  void flushCustomFeedbackType(const std::string& type, std::function<void()> completion);
  // The refusal of the flush runner, if any.
  std::optional<std::string> flushSessionEagerly(const std::filesystem::path& path,
                                                 std::function<void()> completion);
  // Refused when no installed-app controller is wired. The completion gets
  // the stored whitelist signature, if any.
  std::optional<std::string> updateWhitelists(
      uint64_t condition, std::function<void(std::optional<std::string>)> completion);
  void teeUploads(std::function<void()> completion);
  void teeCohortsFeedback(std::function<void()> completion);

  // Work queue only.
  bool isSendingStreamListener() const { return isSendingStreamListener_; }
  bool isCohortsListener() const { return isCohortsListener_; }

  int processIdentifier() const { return pid_; }
  // The client's side of the protocol: payloads sent through it reach this
  // connection's peer. Safe to call from any thread.
  const std::shared_ptr<ClientConduit>& clientProxy() const { return clientProxy_; }

 private:
  void handleFrame(std::string body);
  void serve(const ipc::Request& request);
  void sendReply(uint64_t id, std::optional<std::string> error,
                 std::optional<std::string> signature = std::nullopt);

  FBFAssemblyProtocol& assembly_;
  std::shared_ptr<FlushRunner> runner_;
  std::shared_ptr<ipc::FrameChannel> channel_;
  std::shared_ptr<ClientConduit> clientProxy_;
  const int pid_;
  std::weak_ptr<void> serviceAlive_;
  bool isSendingStreamListener_ = false;
  bool isCohortsListener_ = false;
};

class FlusherService {
 public:
  // `runner` may be null while no flusher is wired: flush requests are then
  // answered with an error.
  FlusherService(FBFAssemblyProtocol& assembly, std::shared_ptr<FlushRunner> runner);
  // Closes every open connection; their invalidations then do nothing.
  ~FlusherService();

  FlusherService(const FlusherService&) = delete;
  FlusherService& operator=(const FlusherService&) = delete;

  // Takes one accepted connection. Call from any thread; the socket's
  // executor must be run for the connection to be served.
  void accept(ipc::UnixSocket socket);

  // Work queue only.
  size_t openConnectionCount() const;

 private:
  struct State;
  std::shared_ptr<State> state_;
};

}  // namespace fbf
