// The IPC service's way to the real feedback flusher: each request gets a
// fresh FeedbackFlusher, kept here until its completion has run.
//
// Lives on the work queue (every call is made there).
#pragma once

#include "flushing/feedback_flusher.h"
#include "ipc/flush_runner.h"

#include <set>

namespace fbf {

class DaemonFlushRunner final : public FlushRunner {
 public:
  DaemonFlushRunner(FBFAssemblyProtocol& assembly, std::function<FlusherDependencies()> dependencies);

  void flushAll(std::function<void()> completion) override;
  void flushCustomFeedbackType(const std::string& type, std::function<void()> completion) override;
  std::optional<std::string> flushSessionEagerly(const std::filesystem::path& path,
                                                 std::function<void()> completion) override;
  ipc::StatusReply status() override;

 private:
  std::shared_ptr<FeedbackFlusher> makeFlusher();
  // Wraps a completion so that the flusher is released and the eager flag
  // cleared once the last client-requested flush has finished.
  std::function<void()> finishing(std::shared_ptr<FeedbackFlusher> flusher, std::function<void()> completion);

  FBFAssemblyProtocol& assembly_;
  std::function<FlusherDependencies()> dependencies_;
  std::set<std::shared_ptr<FeedbackFlusher>> running_;
};

}  // namespace fbf
