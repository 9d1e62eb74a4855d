// The feedback-loss events of the last days, kept for `fbfctl status`.
//
// Every deletion event (also the "uploaded" ones) is appended as one JSON
// line {"time", "type", "reason"} to an owner-only file in the daemon's state
// directory, through a descriptor kept open. Lines older than the window are
// dropped when the ledger is opened (the daemon starts often), so the file
// holds about a week of events. A line that does not parse is skipped.
//
// Thread-safety: all members may be called from any thread.
#pragma once

#include "assembly/feedback_deletion_event.h"
#include "platform/file_manager.h"

#include <chrono>
#include <mutex>
#include <string>
#include <vector>

namespace fbf {

struct FeedbackLossCount {
  int32_t feedbackType = 0;
  int32_t reason = 0;
  uint64_t files = 0;
};

class FeedbackLossLedger {
 public:
  static constexpr std::chrono::hours kWindow{24 * 7};

  FeedbackLossLedger(fs::path file, FileManager& fm, SystemTime now);
  ~FeedbackLossLedger();
  FeedbackLossLedger(const FeedbackLossLedger&) = delete;
  FeedbackLossLedger& operator=(const FeedbackLossLedger&) = delete;

  void record(const FeedbackDeletionEvent& event, SystemTime when);
  // Counts by type and reason of the events at or after `since`, ordered by
  // type, then reason.
  std::vector<FeedbackLossCount> countsSince(SystemTime since) const;

 private:
  fs::path file_;
  FileManager& fm_;
  mutable std::mutex mutex_;
  int fd_ = -1;  // guarded by mutex_
};

}  // namespace fbf
