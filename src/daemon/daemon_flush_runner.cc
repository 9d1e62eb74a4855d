#include "daemon/daemon_flush_runner.h"

#include "assembly/cache_paths.h"
#include "assembly/feedback_types.h"
#include "flushing/session_filename.h"

#include <map>

namespace fbf {
DaemonFlushRunner::DaemonFlushRunner(FBFAssemblyProtocol& assembly, std::function<FlusherDependencies()> deps)
    : assembly_(assembly), dependencies_(std::move(deps)) {}

std::shared_ptr<FeedbackFlusher> DaemonFlushRunner::makeFlusher() {
  auto flusher = FeedbackFlusher::make(assembly_, dependencies_());
  running_.insert(flusher);
  // A client is waiting: uploads carry the real-time marker.
  assembly_.setFlushingEagerly(true);
  return flusher;
}

std::function<void()> DaemonFlushRunner::finishing(std::shared_ptr<FeedbackFlusher> flusher,
                                                   std::function<void()> completion) {
  return [this, flusher, completion = std::move(completion)] {
    // Released on the work queue after this call returns, not inside the
    // flusher's own call stack.
    assembly_.workloop().async([this, flusher] {
      running_.erase(flusher);
      if (running_.empty()) assembly_.setFlushingEagerly(false);
    });
    if (completion) completion();
  };
}

void DaemonFlushRunner::flushAll(std::function<void()> completion) {
  auto flusher = makeFlusher();
  flusher->beginEnumeratingFeedback({}, finishing(flusher, std::move(completion)));
}

void DaemonFlushRunner::flushCustomFeedbackType(const std::string& type, std::function<void()> completion) {
  auto flusher = makeFlusher();
  flusher->beginEnumeratingFeedback({type}, finishing(flusher, std::move(completion)));
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
  auto flusher = makeFlusher();
  flusher->flushSessionEagerly(normal, finishing(flusher, std::move(completion)));
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
  return reply;
}

}  // namespace fbf
