#include "ipc/flusher_service.h"

#include "assembly/fbf_strings.h"
#include "platform/logging.h"
#include "util/build_info.h"

#include <unistd.h>

#include <algorithm>
#include <mutex>
#include <vector>

namespace fbf {
namespace {

spdlog::logger& serviceLog() { return logging::get("FlusherService"); }
spdlog::logger& connectionLog() { return logging::get("FlusherConnection"); }

constexpr const char* kNoFlusher = "no feedback flusher is available";
constexpr const char* kNoWhitelistMaintenance = "whitelist maintenance unavailable";

// Forwards the daemon's calls to the client over the connection. Failures to
// deliver are logged and otherwise ignored: the daemon keeps going.
//
// A subscriber that does not read must not make the daemon hold every
// payload: once `kMaxPendingBytes` wait for it, further payloads are dropped
// for this subscriber alone, and the next one it gets says how many it missed.
class RemoteClientProxy final : public ClientConduit {
 public:
  static constexpr size_t kMaxPendingBytes = size_t{16} << 20;

  explicit RemoteClientProxy(std::shared_ptr<ipc::FrameChannel> channel)
      : channel_(std::move(channel)) {}

  void willUploadData(const std::string& data, const std::string& format) override {
    if (dropIfBehind()) return;
    ipc::DaemonMessage message;
    auto* body = message.mutable_willuploaddata();
    body->set_data(data);
    body->set_format(format);
    body->set_missedbefore(takeMissed());
    send(message);
  }

  void willGenerateCohortFeebacks(const std::string& data) override {
    if (dropIfBehind()) return;
    ipc::DaemonMessage message;
    auto* body = message.mutable_willgeneratecohortfeebacks();
    body->set_data(data);
    body->set_missedbefore(takeMissed());
    send(message);
  }

 private:
  bool dropIfBehind() {
    if (channel_->pendingBytes() < kMaxPendingBytes) return false;
    if (missed_++ == 0) connectionLog().warn("A subscriber is not reading; dropping payloads for it");
    return true;
  }
  uint64_t takeMissed() { return std::exchange(missed_, 0); }

  uint64_t missed_ = 0;

  void send(const ipc::DaemonMessage& message) {
    std::string bytes;
    if (!message.SerializeToString(&bytes)) {
      connectionLog().error("remote proxy error: {}", "message could not be encoded");
      return;
    }
    channel_->send(std::move(bytes), [](const std::string& error) {
      connectionLog().error("remote proxy error: {}", error);
    });
  }

  std::shared_ptr<ipc::FrameChannel> channel_;
};

}  // namespace

// ---- FlusherConnection ----

FlusherConnection::FlusherConnection(FBFAssemblyProtocol& assembly,
                                     std::shared_ptr<FlushRunner> runner,
                                     std::shared_ptr<ipc::FrameChannel> channel,
                                     int processIdentifier, std::weak_ptr<void> serviceAlive)
    : assembly_(assembly),
      runner_(std::move(runner)),
      channel_(std::move(channel)),
      clientProxy_(std::make_shared<RemoteClientProxy>(channel_)),
      pid_(processIdentifier),
      serviceAlive_(std::move(serviceAlive)) {}

FlusherConnection::~FlusherConnection() {
  if (channel_->isOpen()) channel_->close();
}

void FlusherConnection::resume(std::function<void()> onInvalidated) {
  std::weak_ptr<FlusherConnection> weak = weak_from_this();
  channel_->start(
      [weak](std::string body) {
        if (auto self = weak.lock()) self->handleFrame(std::move(body));
      },
      [pid = pid_,
       onInvalidated = std::move(onInvalidated)](const ipc::FrameChannel::Closure& closure) {
        using Reason = ipc::FrameChannel::CloseReason;
        if (closure.reason == Reason::oversizedFrame || closure.reason == Reason::truncatedFrame ||
            closure.reason == Reason::ioError) {
          connectionLog().error("Closing the connection from PID {}: {}", pid, closure.detail);
        }
        if (onInvalidated) onInvalidated();
      });
}

void FlusherConnection::handleFrame(std::string body) {
  if (serviceAlive_.expired()) return;
  ipc::Request request;
  if (!request.ParseFromString(body)) {
    connectionLog().error(
        "Closing the connection from PID {}: a request of {} bytes does not decode", pid_,
        body.size());
    sendReply(0, std::string("malformed request"));
    channel_->close();
    return;
  }
  assembly_.workloop().async([self = shared_from_this(), request = std::move(request)] {
    if (self->serviceAlive_.expired()) return;
    self->serve(request);
  });
}

void FlusherConnection::serve(const ipc::Request& request) {
  const uint64_t id = request.id();
  // Replies go out even when the service is gone by then; the channel drops
  // them once the connection is closed.
  auto done = [self = shared_from_this(), id] { self->sendReply(id, std::nullopt); };

  switch (request.operation_case()) {
    case ipc::Request::kFlush:
      if (!runner_) return sendReply(id, std::string(kNoFlusher));
      flush(done);
      return;
    case ipc::Request::kFlushCustomFeedbackType: {
      const auto& type = request.flushcustomfeedbacktype().type();
      if (type.empty()) return sendReply(id, std::string("missing custom feedback type"));
      if (!runner_) return sendReply(id, std::string(kNoFlusher));
      flushCustomFeedbackType(type, done);
      return;
    }
    case ipc::Request::kFlushSessionEagerly: {
      const auto& path = request.flushsessioneagerly().path();
      if (path.empty()) return sendReply(id, std::string("missing session file path"));
      if (!runner_) return sendReply(id, std::string(kNoFlusher));
      if (auto refusal = flushSessionEagerly(path, done)) sendReply(id, *refusal);
      return;
    }
    case ipc::Request::kUpdateWhitelists: {
      auto refusal =
          updateWhitelists(request.updatewhitelists().condition(),
                           [self = shared_from_this(), id](std::optional<std::string> signature) {
                             self->sendReply(id, std::nullopt, std::move(signature));
                           });
      if (refusal) sendReply(id, *refusal);
      return;
    }
    case ipc::Request::kTeeUploads:
      teeUploads(done);
      return;
    case ipc::Request::kTeeCohortsFeedback:
      teeCohortsFeedback(done);
      return;
    case ipc::Request::kStatus: {
      ipc::DaemonMessage message;
      auto* status = message.mutable_statusreply();
      if (runner_) *status = runner_->status();
      status->set_id(id);
      status->set_uploadslistener(assembly_.uploadListener() != nullptr);
      status->set_cohortslistener(assembly_.cohortsListener() != nullptr);
      status->set_version(kDaemonNameAndVersion);
      status->set_pid(getpid());
      std::string bytes;
      if (message.SerializeToString(&bytes)) channel_->send(std::move(bytes));
      return;
    }
    case ipc::Request::OPERATION_NOT_SET:
      break;
  }
  // A newer client's operation arrives as an unknown field.
  sendReply(id, std::string("unknown or missing operation"));
}

void FlusherConnection::flush(std::function<void()> completion) {
  connectionLog().debug("Service created new flusher");
  runner_->flushAll(std::move(completion));
}

void FlusherConnection::flushCustomFeedbackType(const std::string& type,
                                                std::function<void()> completion) {
  connectionLog().debug("Service created new flusher");
  runner_->flushCustomFeedbackType(type, std::move(completion));
}

std::optional<std::string> FlusherConnection::flushSessionEagerly(
    const std::filesystem::path& path, std::function<void()> completion) {
  connectionLog().debug("Service created new flusher for eager flush of {}", path.string());
  return runner_->flushSessionEagerly(path, std::move(completion));
}

std::optional<std::string> FlusherConnection::updateWhitelists(
    uint64_t condition, std::function<void(std::optional<std::string>)> completion) {
  auto* controller = assembly_.installedAppController();
  if (!controller) return std::string(kNoWhitelistMaintenance);
  FBFAssemblyProtocol& assembly = assembly_;
  // The controller may complete on its own queue; the signature is read back
  // on the work queue like every other use of the defaults.
  controller->updateWhitelists(condition, [&assembly, completion = std::move(completion)] {
    assembly.workloop().async([&assembly, completion] {
      completion(assembly.userDefaults().stringForKey(FBFStrings::kVIRAppWhitelistSignatureKey));
    });
  });
  return std::nullopt;
}

void FlusherConnection::teeUploads(std::function<void()> completion) {
  connectionLog().debug("setting up a new sending stream listener");
  assembly_.setUploadListener(clientProxy_);
  isSendingStreamListener_ = true;
  completion();
}

void FlusherConnection::teeCohortsFeedback(std::function<void()> completion) {
  connectionLog().debug("setting up a new cohort listnener");
  assembly_.setCohortsListener(clientProxy_);
  isCohortsListener_ = true;
  completion();
}

void FlusherConnection::sendReply(uint64_t id, std::optional<std::string> error,
                                  std::optional<std::string> signature) {
  ipc::DaemonMessage message;
  auto* reply = message.mutable_reply();
  reply->set_id(id);
  reply->set_ok(!error.has_value());
  if (error) reply->set_error(*error);
  if (signature) reply->set_whitelistsignature(*signature);
  std::string bytes;
  if (!message.SerializeToString(&bytes)) return;
  channel_->send(std::move(bytes), [pid = pid_, id](const std::string& why) {
    connectionLog().debug("Reply {} to PID {} not delivered: {}", id, pid, why);
  });
}

// ---- FlusherService ----

struct FlusherService::State {
  State(FBFAssemblyProtocol& a, std::shared_ptr<FlushRunner> r)
      : assembly(a), runner(std::move(r)) {}

  // Work queue only.
  void invalidate(const std::shared_ptr<FlusherConnection>& connection, int pid) {
    serviceLog().debug("invalidating connection from PID {}", pid);
    if (connection->isSendingStreamListener()) {
      serviceLog().debug("clearing the sending stream listener");
      assembly.setUploadListener(nullptr);
    }
    if (connection->isCohortsListener()) {
      serviceLog().debug("clearing the cohorts listener");
      assembly.setCohortsListener(nullptr);
    }
    auto it = std::find(openConnections.begin(), openConnections.end(), connection);
    if (it != openConnections.end()) openConnections.erase(it);
  }

  FBFAssemblyProtocol& assembly;
  std::shared_ptr<FlushRunner> runner;
  std::vector<std::shared_ptr<FlusherConnection>> openConnections;  // work queue only

  // Every channel handed out, so the service can close them when it goes.
  std::mutex channelsMutex;
  std::vector<std::weak_ptr<ipc::FrameChannel>> channels;
};

FlusherService::FlusherService(FBFAssemblyProtocol& assembly, std::shared_ptr<FlushRunner> runner)
    : state_(std::make_shared<State>(assembly, std::move(runner))) {}

FlusherService::~FlusherService() {
  std::vector<std::weak_ptr<ipc::FrameChannel>> channels;
  {
    std::lock_guard lock(state_->channelsMutex);
    channels.swap(state_->channels);
  }
  for (auto& weak : channels) {
    if (auto channel = weak.lock()) channel->close();
  }
}

void FlusherService::accept(ipc::UnixSocket socket) {
  const int pid = ipc::peerProcessId(socket).value_or(-1);
  serviceLog().debug("new connection from PID {}", pid);

  auto channel = ipc::FrameChannel::make(std::move(socket), ipc::kMaxRequestFrameBytes,
                                         ipc::kMaxDaemonFrameBytes);
  {
    std::lock_guard lock(state_->channelsMutex);
    std::erase_if(state_->channels, [](const auto& weak) { return weak.expired(); });
    state_->channels.push_back(channel);
  }
  auto connection =
      std::make_shared<FlusherConnection>(state_->assembly, state_->runner, channel, pid, state_);

  // Registered before reading starts, so the invalidation that may follow
  // immediately always finds it (both run in order on the work queue).
  std::weak_ptr<State> weakState = state_;
  state_->assembly.workloop().async([weakState, connection] {
    if (auto state = weakState.lock()) state->openConnections.push_back(connection);
  });

  TaskQueue& workloop = state_->assembly.workloop();
  connection->resume([weakState, connection, pid, &workloop]() mutable {
    workloop.async([weakState, connection = std::move(connection), pid] {
      if (auto state = weakState.lock()) state->invalidate(connection, pid);
    });
  });
}

size_t FlusherService::openConnectionCount() const { return state_->openConnections.size(); }

}  // namespace fbf
