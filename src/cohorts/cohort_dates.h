// Calendar arithmetic for the usage cohorts: a Gregorian calendar in a time
// zone (the process's, from TZ, unless one is named), on ICU.
//
// Capture ranges are the calendar periods cohorts are aggregated over: the
// day, the week of the year (first weekday and minimal days of week 1 from
// the calendar's locale) or the month that contains a date, as half-open
// intervals from the first instant of a local day to the first instant of
// another. A day is therefore 23 or 25 hours long across a daylight-saving
// change, and starts at 01:00 where that change skips midnight (America/
// Santiago, America/Havana, Asia/Beirut, America/Sao_Paulo in some years).
// Day counts are differences of local dates, never elapsed time / 24 h.
//
// Thread-safety: a calendar is used by one thread at a time (it keeps ICU
// state that every operation changes); copies are independent.
#pragma once

#include "cohorts/usage_model.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>

namespace fbf {

class CohortCalendar {
 public:
  // The process's time zone (TZ) and week rule at this moment; the week rule
  // comes from `weekRuleLocale(getenv)`.
  static CohortCalendar current();
  // The locale whose week rule applies, by POSIX precedence: the first
  // non-empty of LC_ALL, LC_TIME and LANG, without codeset and modifier
  // ("en_GB.UTF-8" gives "en_GB"); "en_US_POSIX" for none, "C" or "POSIX".
  static std::string weekRuleLocale(const std::function<const char*(const char*)>& getenv);
  // A named zone ("America/New_York") and locale ("de_DE"); an unknown zone
  // is GMT, as ICU has it.
  CohortCalendar(std::string_view timeZoneId, std::string_view localeId);
  CohortCalendar(const CohortCalendar& other);
  CohortCalendar& operator=(const CohortCalendar& other);
  ~CohortCalendar();

  // The period of the frequency that contains `date`; no value when the
  // calendar cannot form it.
  std::optional<DateInterval> containingCaptureRange(FlushFrequency frequency, SystemTime date) const;
  // The period to aggregate after one that ended at `lastEnd`: from `lastEnd`
  // to the end of the capture range containing it. Normally that is exactly
  // the next capture range; after a change of time zone or week rule it is
  // the remainder of the period `lastEnd` falls in.
  std::optional<DateInterval> periodAfter(FlushFrequency frequency, SystemTime lastEnd) const;
  // The month containing `date`.
  std::optional<DateInterval> containingMonth(SystemTime date) const;
  // Whole elapsed hours from `from` to `to` (negative when `to` is earlier).
  std::optional<int64_t> wholeHours(SystemTime from, SystemTime to) const;
  // Calendar days from `from` to `to`: the local date of `to` minus the local
  // date of `from` (negative when `to` is earlier).
  std::optional<int64_t> wholeDays(SystemTime from, SystemTime to) const;
  // `date` moved by a number of calendar days, keeping the wall-clock time.
  std::optional<SystemTime> addingDays(SystemTime date, int64_t days) const;
  // The (year, month, day) of `date`, for counting distinct days.
  std::optional<std::tuple<int32_t, int32_t, int32_t>> dayOf(SystemTime date) const;

  std::string timeZoneId() const;

 private:
  struct Impl;
  explicit CohortCalendar(std::unique_ptr<Impl> impl);
  std::unique_ptr<Impl> impl_;
};

// "2024-05-01 12:00:00 +0000": a date in log lines, in UTC.
std::string formatDateForLog(SystemTime date);

}  // namespace fbf
