#include "ipc/control_client.h"

#include <future>

namespace fbf::ipc {

std::unique_ptr<ControlClient> ControlClient::connect(const std::filesystem::path& socketPath,
                                                      std::string* error) {
  auto connection = DaemonConnection::connect(socketPath, error);
  if (!connection) return nullptr;
  return std::unique_ptr<ControlClient>(new ControlClient(std::move(connection)));
}

ControlClient::ControlClient(std::shared_ptr<DaemonConnection> connection)
    : connection_(std::move(connection)), inbox_(std::make_shared<Inbox>()) {
  connection_->setMessageHandler([inbox = inbox_](const DaemonMessage& message) {
    std::lock_guard lock(inbox->mutex);
    inbox->messages.push_back(message);
    inbox->changed.notify_all();
  });
  connection_->setEndHandler([inbox = inbox_](const std::string& reason) {
    std::lock_guard lock(inbox->mutex);
    inbox->ended = reason;
    inbox->changed.notify_all();
  });
  connection_->resume();
}

ControlClient::~ControlClient() { connection_->invalidate(); }

std::optional<DaemonMessage> ControlClient::call(Request request, std::string* error) {
  auto answer =
      std::make_shared<std::promise<std::pair<std::optional<DaemonMessage>, std::string>>>();
  auto future = answer->get_future();
  connection_->send(
      std::move(request),
      [answer](const DaemonMessage& message) {
        answer->set_value({message, std::string()});
      },
      [answer](const std::string& why) {
        answer->set_value({std::nullopt, why});
      });
  auto [message, why] = future.get();
  if (!message && error) *error = why;
  return message;
}

ControlOutcome ControlClient::callForReply(Request request) {
  ControlOutcome outcome;
  auto message = call(std::move(request), &outcome.error);
  if (!message) return outcome;
  if (!message->has_reply()) {
    outcome.error = "unexpected answer from the daemon";
    return outcome;
  }
  const auto& reply = message->reply();
  outcome.ok = reply.ok();
  if (!reply.ok())
    outcome.error = reply.has_error() ? reply.error() : std::string("request failed");
  if (reply.has_whitelistsignature()) outcome.whitelistSignature = reply.whitelistsignature();
  return outcome;
}

ControlOutcome ControlClient::flush() {
  Request r;
  r.mutable_flush();
  return callForReply(std::move(r));
}

ControlOutcome ControlClient::flushCustomFeedbackType(const std::string& type) {
  Request r;
  r.mutable_flushcustomfeedbacktype()->set_type(type);
  return callForReply(std::move(r));
}

ControlOutcome ControlClient::flushSessionEagerly(const std::filesystem::path& path) {
  Request r;
  r.mutable_flushsessioneagerly()->set_path(path.string());
  return callForReply(std::move(r));
}

ControlOutcome ControlClient::updateWhitelists(uint64_t condition) {
  Request r;
  r.mutable_updatewhitelists()->set_condition(condition);
  return callForReply(std::move(r));
}

std::optional<StatusReply> ControlClient::status(std::string* error) {
  Request r;
  r.mutable_status();
  auto message = call(std::move(r), error);
  if (!message) return std::nullopt;
  if (!message->has_statusreply()) {
    if (error) {
      *error = message->has_reply() && message->reply().has_error()
                   ? message->reply().error()
                   : std::string("unexpected answer from the daemon");
    }
    return std::nullopt;
  }
  return message->statusreply();
}

ControlOutcome ControlClient::tee(TeeKind kind, const std::function<void()>& onSubscribed,
                                  const std::function<bool(const DaemonMessage&)>& onMessage) {
  Request r;
  if (kind == TeeKind::uploads) {
    r.mutable_teeuploads();
  } else {
    r.mutable_teecohortsfeedback();
  }
  ControlOutcome subscribed = callForReply(std::move(r));
  if (!subscribed.ok) return subscribed;
  if (onSubscribed) onSubscribed();
  while (true) {
    DaemonMessage message;
    {
      std::unique_lock lock(inbox_->mutex);
      inbox_->changed.wait(lock, [&] { return !inbox_->messages.empty() || inbox_->ended; });
      if (inbox_->messages.empty()) return ControlOutcome{false, *inbox_->ended, std::nullopt};
      message = std::move(inbox_->messages.front());
      inbox_->messages.pop_front();
    }
    if (!onMessage(message)) return ControlOutcome{true, std::string(), std::nullopt};
  }
}

}  // namespace fbf::ipc
