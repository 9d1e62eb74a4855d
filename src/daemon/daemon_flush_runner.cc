#include "daemon/daemon_flush_runner.h"

#include "assembly/cache_paths.h"
#include "assembly/feedback_types.h"
#include "cohorts/cohorts_status.h"
#include "flushing/session_filename.h"
#include "flushing/session_recovery.h"

#include <map>

namespace fbf {
DaemonFlushRunner::DaemonFlushRunner(FBFAssemblyProtocol& assembly, std::function<FlusherDependencies()> deps)
    : assembly_(assembly), dependencies_(std::move(deps)) {}

void DaemonFlushRunner::schedule(PendingFlush flush) {
  waiting_.push_back(std::move(flush));
  startNextIfIdle();
}

void DaemonFlushRunner::startNextIfIdle() {
  if (current_ || waiting_.empty()) return;
  PendingFlush next = std::move(waiting_.front());
  waiting_.pop_front();
  auto flusher = FeedbackFlusher::make(assembly_, dependencies_());
  current_ = flusher;
  if (next.handle) *next.handle = flusher;
  // A client is waiting: its uploads carry the real-time marker.
  assembly_.setFlushingEagerly(next.clientRequested);
  next.start(flusher, [this, flusher, completion = std::move(next.completion)] {
    // Released on the work queue after this call returns, not inside the
    // flusher's own call stack.
    assembly_.workloop().async([this, flusher] {
      if (current_ == flusher) current_.reset();
      assembly_.setFlushingEagerly(false);
      startNextIfIdle();
    });
    if (completion) completion();
  });
}

void DaemonFlushRunner::flushAll(std::function<void()> completion) {
  schedule({[](const auto& flusher, auto done) { flusher->beginEnumeratingFeedback({}, std::move(done)); },
            std::move(completion), true, nullptr});
}

void DaemonFlushRunner::flushCustomFeedbackType(const std::string& type, std::function<void()> completion) {
  schedule({[type](const auto& flusher, auto done) { flusher->beginEnumeratingFeedback({type}, std::move(done)); },
            std::move(completion), true, nullptr});
}

std::function<void()> DaemonFlushRunner::beginPeriodicFlush(std::function<void()> completion) {
  auto handle = std::make_shared<std::weak_ptr<FeedbackFlusher>>();
  auto stopped = std::make_shared<std::atomic<bool>>(false);
  assembly_.workloop().async([this, handle, stopped, completion = std::move(completion)]() mutable {
    schedule({[stopped](const auto& flusher, auto done) {
                flusher->beginEnumeratingFeedback({}, std::move(done));
                if (*stopped) flusher->stopEnumeratingFeedback();
              },
              std::move(completion), false, handle});
  });
  return [this, handle, stopped] {
    *stopped = true;
    assembly_.workloop().async([handle] {
      if (auto flusher = handle->lock()) flusher->stopEnumeratingFeedback();
    });
  };
}

std::optional<std::string> DaemonFlushRunner::flushSessionEagerly(const std::filesystem::path& path,
                                                                  std::function<void()> completion) {
  auto cacheDir = cacheDirNoCreate(assembly_.fileManager());
  if (!cacheDir) return "the cache directory does not exist";
  if (!path.is_absolute()) return "not an absolute path: " + path.string();
  // Judged on the path as written, made lexical: the file must sit directly
  // in the cache directory (a link there is refused later, when it is not a
  // regular file).
  auto normal = path.lexically_normal();
  if (normal.parent_path() != cacheDir->lexically_normal()) return "not in the cache directory: " + path.string();
  if (!SessionFilename::fromString(normal.filename().string())) return "not a session file name: " + path.string();
  schedule({[normal](const auto& flusher, auto done) { flusher->flushSessionEagerly(normal, std::move(done)); },
            std::move(completion), true, nullptr});
  return std::nullopt;
}

ipc::StatusReply DaemonFlushRunner::status() {
  ipc::StatusReply reply;
  auto& fm = assembly_.fileManager();
  auto cacheDir = cacheDirNoCreate(fm);
  if (!cacheDir) return reply;
  const auto now = assembly_.currentDate();
  struct Tally {
    uint64_t files = 0, bytes = 0;
    std::optional<SystemTime> oldest;
  };
  auto add = [](Tally& t, const FileAttributes& a) {
    ++t.files;
    t.bytes += a.size;
    if (!t.oldest || a.creationDate < *t.oldest) t.oldest = a.creationDate;
  };
  auto emit = [&](auto* list, const std::string& name, const Tally& t) {
    auto* p = list->Add();
    p->set_name(name);
    p->set_files(t.files);
    p->set_bytes(t.bytes);
    if (t.oldest) p->set_oldestageseconds(std::chrono::duration_cast<std::chrono::seconds>(now - *t.oldest).count());
  };

  std::map<std::string, Tally> sessions;
  if (auto walk = fm.enumerate(*cacheDir)) {
    while (auto e = walk->next()) {
      if (!e->attributes.isRegular()) continue;
      auto parsed = SessionFilename::fromString(e->name);
      if (!parsed) continue;
      add(sessions[parsed->uploadPending ? "uploadPending" : std::string(toString(parsed->state))], e->attributes);
    }
  }
  for (const auto& [name, t] : sessions) emit(reply.mutable_sessions(), name, t);

  if (auto custom = customFeedbackDir(fm)) {
    for (const auto& type : allCustomFeedbackDirectories()) {
      Tally t;
      if (auto walk = fm.enumerate(*custom / type)) {
        while (auto e = walk->next()) {
          if (e->attributes.isRegular()) add(t, e->attributes);
        }
      }
      if (t.files) emit(reply.mutable_customfeedback(), type, t);
    }
  }
  fillCohortsStatus(fm, reply);
  for (const auto& loss : assembly_.feedbackLossesSince(now - FeedbackLossLedger::kWindow)) {
    auto* item = reply.add_losseslast7days();
    item->set_type(knownFeedbackTypeName(loss.feedbackType));
    item->set_reason(deletionReasonName(loss.reason));
    item->set_reasoncode(loss.reason);
    item->set_files(loss.files);
  }
  for (const auto& poison : poisonSessionFiles(fm)) reply.add_poisonfiles(poison.filename().string());
  return reply;
}

}  // namespace fbf
