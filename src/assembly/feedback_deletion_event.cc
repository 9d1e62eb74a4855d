#include "assembly/feedback_deletion_event.h"

#include "assembly/feedback_types.h"

namespace fbf {

std::optional<FeedbackDeletionEvent> FeedbackDeletionEvent::make(const fs::path& file, int32_t feedbackType,
                                                                 int32_t reason, SystemTime when,
                                                                 const FileManager& fm) {
  auto attrs = fm.attributes(file);
  if (!attrs) return std::nullopt;
  if (feedbackType == kKnownFeedbackTypeUnknown || feedbackType == kKnownFeedbackTypeLast) return std::nullopt;
  FeedbackDeletionEvent e;
  e.feedbackType = feedbackType;
  e.reason = reason;
  e.size = attrs->size / 1024 + (attrs->size % 1024 != 0 ? 1 : 0);
  e.age = static_cast<int64_t>(std::chrono::duration<double>(when - attrs->creationDate).count());
  return e;
}

nlohmann::json FeedbackDeletionEvent::toJSON() const {
  return {{"feedbackType", feedbackType}, {"reason", reason}, {"size", size}, {"age", age}};
}

}  // namespace fbf
