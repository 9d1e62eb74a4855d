// Runs the daemon's flushes, one at a time: the periodic one and those that
// clients ask for over IPC. Two walks over the same cache directory at once
// would race for the same files (the fresh upload file of one looks like a
// left-over to the other and would be sent twice), so a request that arrives
// while a flush runs waits for it to end, then gets a fresh FeedbackFlusher.
//
// Lives on the work queue: every call is made there, except
// `beginPeriodicFlush`, which may be called from any thread.
#pragma once

#include "flushing/feedback_flusher.h"
#include "ipc/flush_runner.h"

#include <deque>

namespace fbf {

class DaemonFlushRunner final : public FlushRunner {
 public:
  DaemonFlushRunner(FBFAssemblyProtocol& assembly, std::function<FlusherDependencies()> dependencies);

  void flushAll(std::function<void()> completion) override;
  void flushCustomFeedbackType(const std::string& type, std::function<void()> completion) override;
  std::optional<std::string> flushSessionEagerly(const std::filesystem::path& path,
                                                 std::function<void()> completion) override;
  ipc::StatusReply status() override;

  // A full flush for the periodic activity. Returns the function that asks
  // it to stop after the file in progress (also before it has started).
  std::function<void()> beginPeriodicFlush(std::function<void()> completion);

 private:
  using Start = std::function<void(const std::shared_ptr<FeedbackFlusher>&, std::function<void()> done)>;
  struct PendingFlush {
    Start start;
    std::function<void()> completion;
    bool clientRequested = true;
    std::shared_ptr<std::weak_ptr<FeedbackFlusher>> handle;  // filled when it starts
  };
  void schedule(PendingFlush flush);
  void startNextIfIdle();

  FBFAssemblyProtocol& assembly_;
  std::function<FlusherDependencies()> dependencies_;
  std::deque<PendingFlush> waiting_;
  std::shared_ptr<FeedbackFlusher> current_;
};

}  // namespace fbf
