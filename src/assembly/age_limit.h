// The age limit of feedback files, from the bag's "feedback_max_age_in_days".
//
// The bag comes from another program and may hold anything. A limit so large
// that it overflows when counted in seconds means "no limit", with a warning
// where the limit is made (once per flush). A limit of 0 or less is taken at
// its word: every file is too old. Value type; no state beyond the limit.
#pragma once

#include "assembly/configuration_bag.h"
#include "platform/clock.h"

#include <cstdint>
#include <optional>

namespace fbf {

class FeedbackAgeLimit {
 public:
  // The bag's limit, or 7 days when the bag or the value is absent.
  static FeedbackAgeLimit fromBag(const std::optional<ConfigurationBag>& bag);
  static FeedbackAgeLimit fromDays(int64_t days);

  // Whether a file created at `creation` is strictly younger than the limit
  // at `now`. A creation date in the future counts as young.
  bool allows(SystemTime creation, SystemTime now) const;
  // No value: no limit.
  std::optional<int64_t> seconds() const { return seconds_; }

 private:
  std::optional<int64_t> seconds_;
};

}  // namespace fbf
