// How the IPC service reaches the feedback flusher.
//
// The service only knows this interface; the composition root hands it an
// implementation over the real flusher, tests a fake. Every call is made on
// the assembly's work queue, and every completion must be called exactly once,
// on the work queue, when the work it stands for has finished (for a flush:
// enumeration done and every upload it started has its outcome).
#pragma once

#include "fbf_ipc.pb.h"

#include <filesystem>
#include <functional>
#include <optional>
#include <string>

namespace fbf {

class FlushRunner {
 public:
  virtual ~FlushRunner() = default;

  // A full flush pass over every session and custom feedback file.
  virtual void flushAll(std::function<void()> completion) = 0;

  // A flush pass over the custom feedback files of one type.
  virtual void flushCustomFeedbackType(const std::string& type,
                                       std::function<void()> completion) = 0;

  // Flushes one session file. Refuses, by returning the reason and never
  // calling `completion`, a path outside the cache directory or a file name
  // that is not a session file name. `path` comes from another process as
  // it was sent: it may be relative, contain "..", or lead through a
  // symbolic link, and must be judged after resolving it.
  virtual std::optional<std::string> flushSessionEagerly(const std::filesystem::path& path,
                                                         std::function<void()> completion) = 0;

  // The pending files, by session file state and by custom feedback type. The
  // service fills in the request id, the listener flags, version and pid.
  virtual ipc::StatusReply status() = 0;
};

}  // namespace fbf
