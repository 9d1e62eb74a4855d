// Operations on the shared cache directory: listing the session files,
// creating the subdirectories, renaming a session file on a state change,
// repairing files left behind by crashed writers, pruning, and persisting
// custom feedback records.
//
// Only regular files owned by this user are ever listed, renamed or counted:
// a link, FIFO, socket or directory with a session-like name is skipped with
// a log line and never followed. Every "now" comes from the caller.
// Thread-safety: no state of its own; callers serialise work on one cache
// directory on the work queue.
#pragma once

#include "assembly/cache_paths.h"
#include "flushing/session_filename.h"
#include "platform/file_manager.h"

#include <functional>
#include <memory>
#include <optional>
#include <string_view>
#include <system_error>
#include <vector>

namespace fbf {

// Streams the session files of the cache directory: regular files owned by
// this user, directly in the directory, whose names start with "session".
// Holds one open directory; memory does not grow with the number of files.
class SessionFileEnumerator {
 public:
  explicit SessionFileEnumerator(std::unique_ptr<DirectoryEnumerator> entries);
  // The next session file with its attributes (read without following links),
  // or no value once the directory is exhausted or has gone away.
  std::optional<DirectoryEntry> next();

 private:
  std::unique_ptr<DirectoryEnumerator> entries_;
};

// No value when the cache directory cannot be found or opened.
std::optional<SessionFileEnumerator> sessionFiles(const FileManager& fm);

// Creates "CustomFeedback" and "Cohorts" under the cache directory (owner-only,
// repairing the modes of existing ones). Failures are logged.
void createRequiredCacheSubdirectories(FileManager& fm);

// Renames a session file, in its own directory, to its name with `newState`
// (the plain name: an upload suffix is dropped). Returns the new path; no
// value, with `error` set, when the name does not parse, the path is not a
// regular file (links are never followed), the target name is already taken,
// or the move fails.
std::optional<fs::path> vireon_renameForStateChange(FileManager& fm, const fs::path& sessionFile,
                                                    SessionFileState newState,
                                                    std::error_code& error);

// Run before each flush enumerates: removes session files whose names do not
// parse, and closes open files whose writer is presumed dead (created more
// than 1800 s before `now`). Processing and uploaded files are left alone.
void vireon_cleanup(FileManager& fm, SystemTime now);

// Session files that pruning neither counts nor removes (uploads a flush has
// queued). Empty: none.
using SessionFileExemption = std::function<bool(const fs::path& file)>;

// When there are more than `maximum` session files, the oldest by creation
// date (ties by name) to remove so that `maximum / 2` remain; else nothing.
std::vector<fs::path> vireon_getPrunedSessionFiles(const FileManager& fm, int maximum,
                                                   const SessionFileExemption& exempt = {});

// Called with each file just before pruning removes it, so that its loss can
// be reported while its attributes can still be read.
using SessionFileRemovalObserver = std::function<void(const fs::path& file)>;

// Removes the files `vireon_getPrunedSessionFiles` selects, logging each
// failure and going on. Returns how many were removed.
size_t vireon_pruneSessionFiles(FileManager& fm, int maximum,
                                const SessionFileRemovalObserver& willRemove = {},
                                const SessionFileExemption& exempt = {});

// Removes the item; on failure logs "<message>: <error>" and returns false.
bool vireon_removeItemOrLogError(FileManager& fm, const fs::path& path, std::string_view message);

// Writes a custom feedback record of a known custom type (a code whose name
// is one of `allCustomFeedbackDirectories`) to
// CustomFeedback/<type name>/<fileName>, owner-only, atomically. `fileName`
// must be one plain path component. Returns the file's path, or no value
// after logging the failure.
std::optional<fs::path> persistCustomFeedback(FileManager& fm, std::string_view bytes, int typeCode,
                                              std::string_view fileName);

// The session files that carry an upload suffix, oldest first (creation date,
// then name): uploads that an earlier run left to be retried.
std::vector<DirectoryEntry> sessionFilesAwaitingUpload(const FileManager& fm);

}  // namespace fbf
