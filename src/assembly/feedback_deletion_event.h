// The record of one feedback file dropped without having been uploaded (or
// deleted after its upload), sent to analytics as "vireond.feedbackLoss".
#pragma once

#include "platform/clock.h"
#include "platform/file_manager.h"

#include <nlohmann/json.hpp>

#include <cstdint>
#include <optional>
#include <string>

namespace fbf {

// Raw values of the deletion reasons (CVFeedbackDeletionReason) that callers pass.
struct FeedbackDeletionReason {
  static constexpr int32_t tooOld = 1;
  static constexpr int32_t tooLarge = 2;
  static constexpr int32_t empty = 3;
  static constexpr int32_t pruned = 4;
  static constexpr int32_t noConsent = 5;
  static constexpr int32_t unreadable = 6;
  static constexpr int32_t uploaded = 12;
};

// "tooOld", "pruned", "uploaded" ...; "(unknown: N)" for other codes.
std::string deletionReasonName(int32_t reason);

struct FeedbackDeletionEvent {
  int32_t feedbackType = 0;  // known feedback type code
  int32_t reason = 0;        // deletion reason code
  uint64_t size = 0;         // KiB, rounded up
  int64_t age = 0;           // seconds from creation to deletion, truncated

  // No value when the file's attributes cannot be read, or for the types 0
  // (unknown) and 14 (end marker), whose losses are never reported.
  static std::optional<FeedbackDeletionEvent> make(const fs::path& file, int32_t feedbackType, int32_t reason,
                                                   SystemTime when, const FileManager& fm);
  // The same from attributes read earlier (the file may be gone by now).
  static std::optional<FeedbackDeletionEvent> make(const FileAttributes& attributes, int32_t feedbackType,
                                                   int32_t reason, SystemTime when);

  // Exactly the keys "feedbackType", "reason", "size", "age".
  nlohmann::json toJSON() const;

  bool operator==(const FeedbackDeletionEvent&) const = default;
};

}  // namespace fbf
