// Start-up recovery of the files an earlier run left half-way, before the
// first flush of this run.
//
// A session file in the "processing" state belongs to no one once the
// process that claimed it is gone:
//  - if its upload file exists, the payload is safe there (an upload file
//    appears under its name only once whole): the processing file goes;
//  - otherwise it returns to "closed", once, and the session is processed
//    again by the next flush;
//  - a session found interrupted a second time is kept as it is: something
//    in it may be what stops the process. It is listed as a poison file (by
//    `fbfctl status`), and the age and pruning rules still apply to it.
// Which sessions were returned once is remembered in "fbf-interrupted" in
// the cache directory (owner-only JSON, rewritten atomically).
//
// A custom feedback file whose upload file exists beside it is removed for
// the same reason, and partial upload files (".<name>.partial") are removed.
//
// Stateless functions; called on the work queue.
#pragma once

#include "platform/file_manager.h"

#include <set>
#include <string>
#include <vector>

namespace fbf {

struct RecoveryResult {
  size_t processingRemoved = 0;
  size_t returnedToClosed = 0;
  size_t poisonFiles = 0;
  size_t customRemoved = 0;
  size_t partialsRemoved = 0;
};

// `keepProcessingWithUpload`: with "LeaveFeedbackAfterUpload" the processing
// file waits for its upload's success to become "uploaded", so it stays.
RecoveryResult recoverInterruptedFiles(FileManager& fm, bool keepProcessingWithUpload);

// The session UUIDs that recovery has returned to "closed" once.
std::set<std::string> interruptedSessionIDs(const FileManager& fm);

// The session files that were interrupted twice and are kept as they are.
std::vector<fs::path> poisonSessionFiles(const FileManager& fm);

}  // namespace fbf
