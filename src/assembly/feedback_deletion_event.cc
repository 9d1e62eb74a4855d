#include "assembly/feedback_deletion_event.h"

#include "assembly/feedback_types.h"

namespace fbf {

std::optional<FeedbackDeletionEvent> FeedbackDeletionEvent::make(const fs::path& file, int32_t feedbackType,
                                                                 int32_t reason, SystemTime when,
                                                                 const FileManager& fm) {
  auto attrs = fm.attributes(file);
  if (!attrs) return std::nullopt;
  return make(*attrs, feedbackType, reason, when);
}

std::optional<FeedbackDeletionEvent> FeedbackDeletionEvent::make(const FileAttributes& attrs, int32_t feedbackType,
                                                                 int32_t reason, SystemTime when) {
  if (feedbackType == kKnownFeedbackTypeUnknown || feedbackType == kKnownFeedbackTypeLast) return std::nullopt;
  FeedbackDeletionEvent e;
  e.feedbackType = feedbackType;
  e.reason = reason;
  e.size = attrs.size / 1024 + (attrs.size % 1024 != 0 ? 1 : 0);
  e.age = static_cast<int64_t>(std::chrono::duration<double>(when - attrs.creationDate).count());
  return e;
}

nlohmann::json FeedbackDeletionEvent::toJSON() const {
  return {{"feedbackType", feedbackType}, {"reason", reason}, {"size", size}, {"age", age}};
}

std::string deletionReasonName(int32_t reason) {
  switch (reason) {
    case 1: return "tooOld";
    case 2: return "tooLarge";
    case 3: return "empty";
    case 4: return "pruned";
    case 5: return "noConsent";
    case 6: return "unreadable";
    case 7: return "undecodable";
    case 8: return "noFeedback";
    case 12: return "uploaded";
    default: return "(unknown: " + std::to_string(reason) + ")";
  }
}

}  // namespace fbf
