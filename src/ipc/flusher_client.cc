#include "ipc/flusher_client.h"

#include "platform/logging.h"

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("FlusherClient", logging::kSiblingSubsystem); }

}  // namespace

FlusherClient::FlusherClient(std::shared_ptr<ipc::DaemonConnection> connection)
    : connection_(std::move(connection)),
      invalidationQueue_(makeSerialQueue("vireon-fbf.invalidation")) {
  if (connection_) connection_->resume();
  log().debug("Initiating new connection to FBF");
}

FlusherClient::~FlusherClient() {
  if (connection_) connection_->invalidate();
}

void FlusherClient::flushSessionEagerly(const std::filesystem::path& url,
                                        std::function<void()> completion) {
  if (!connection_) {
    log().error("FBF proxy didn't conform to expected remote object protocol");
    return;
  }
  log().debug("Flushing session {} eagerly.", url.string());
  ipc::Request r;
  r.mutable_flushsessioneagerly()->set_path(url.string());
  request(std::move(r), "Eager flush finished", std::move(completion));
}

void FlusherClient::updateWhitelists(uint64_t condition, std::function<void()> completion) {
  if (!connection_) {
    log().error("FBF proxy didn't conform to expected remote object protocol");
    return;
  }
  log().debug("Asking FBF to generate App Whitelist signature.");
  ipc::Request r;
  r.mutable_updatewhitelists()->set_condition(condition);
  request(std::move(r), "Whitelist generation queued", std::move(completion));
}

void FlusherClient::request(ipc::Request request, const char* finishedMessage,
                            std::function<void()> completion) {
  // The handlers hold what they use, so the client may be dropped inside the
  // completion.
  connection_->send(
      std::move(request),
      [finishedMessage, completion = std::move(completion), connection = std::weak_ptr(connection_),
       queue = invalidationQueue_](const ipc::DaemonMessage& message) {
        log().debug("{}", finishedMessage);
        if (message.has_reply() && !message.reply().ok()) {
          log().error("FBF refused the request: {}", message.reply().error());
        }
        if (completion) completion();
        queue->async([connection] {
          if (auto c = connection.lock()) c->invalidate();
        });
      },
      [](const std::string& error) { log().error("fbf connection closed with error: {}", error); });
}

}  // namespace fbf
