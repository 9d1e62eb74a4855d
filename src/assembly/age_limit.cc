#include "assembly/age_limit.h"

#include "assembly/fbf_strings.h"
#include "platform/logging.h"

#include <chrono>

namespace fbf {

FeedbackAgeLimit FeedbackAgeLimit::fromBag(const std::optional<ConfigurationBag>& bag) {
  int64_t days = FBFConstants::DefaultFeedbackMaxAgeInDays;
  if (bag) days = bag->feedbackMaxAgeInDays().value_or(days);
  return fromDays(days);
}

FeedbackAgeLimit FeedbackAgeLimit::fromDays(int64_t days) {
  auto& log = logging::get("FBFAssembly");
  FeedbackAgeLimit limit;
  int64_t seconds = 0;
  if (__builtin_mul_overflow(days, FBFConstants::SecondsPerDay, &seconds)) {
    log.warn("feedback_max_age_in_days {} is too large to count in seconds; files are kept whatever their age", days);
    return limit;
  }
  limit.seconds_ = seconds;
  return limit;
}

bool FeedbackAgeLimit::allows(SystemTime creation, SystemTime now) const {
  if (!seconds_) return true;
  // Whole seconds, truncated, as the age rule counts them.
  int64_t age = std::chrono::duration_cast<std::chrono::seconds>(now - creation).count();
  return *seconds_ > age;
}

}  // namespace fbf
