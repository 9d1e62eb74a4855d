#include "cohorts/cohort_dates.h"

#include <unicode/calendar.h>
#include <unicode/gregocal.h>
#include <unicode/locid.h>
#include <unicode/timezone.h>

#include <fmt/format.h>

#include <cstdlib>
#include <ctime>

namespace fbf {

struct CohortCalendar::Impl {
  std::unique_ptr<icu::Calendar> calendar;

  UDate startOfDay(UDate t, UErrorCode& status) {
    calendar->setTime(t, status);
    calendar->set(UCAL_HOUR_OF_DAY, 0);
    calendar->set(UCAL_MINUTE, 0);
    calendar->set(UCAL_SECOND, 0);
    calendar->set(UCAL_MILLISECOND, 0);
    return calendar->getTime(status);
  }
  UDate addDays(UDate t, int32_t days, UErrorCode& status) {
    calendar->setTime(t, status);
    calendar->add(UCAL_DATE, days, status);
    return calendar->getTime(status);
  }
};

namespace {

UDate toUDate(SystemTime t) { return secondsSinceEpoch(t) * 1000.0; }
SystemTime fromUDate(UDate d) { return timeFromSeconds(d / 1000.0); }

std::unique_ptr<icu::Calendar> makeGregorian(icu::TimeZone* zone, const icu::Locale& locale) {
  UErrorCode status = U_ZERO_ERROR;
  auto calendar = std::make_unique<icu::GregorianCalendar>(zone, locale, status);
  if (U_FAILURE(status)) return nullptr;
  return calendar;
}

}  // namespace

CohortCalendar::CohortCalendar(std::unique_ptr<Impl> impl) : impl_(std::move(impl)) {}

std::string CohortCalendar::weekRuleLocale(const std::function<const char*(const char*)>& getenv) {
  std::string value;
  for (const char* name : {"LC_ALL", "LC_TIME", "LANG"}) {
    const char* v = getenv(name);
    if (v != nullptr && *v != '\0') {
      value = v;
      break;
    }
  }
  // "de_DE.UTF-8@euro": ICU wants the language and territory only.
  value = value.substr(0, value.find_first_of(".@"));
  if (value.empty() || value == "C" || value == "POSIX") return "en_US_POSIX";
  return value;
}

CohortCalendar CohortCalendar::current() {
  // Detected anew (not ICU's cached defaults), so the zone is the one TZ names
  // and the week rule the one the time locale names at this moment. ICU's
  // default locale would follow LANG (or LC_MESSAGES) and ignore LC_TIME.
  auto impl = std::make_unique<Impl>();
  impl->calendar = makeGregorian(icu::TimeZone::detectHostTimeZone(),
                                 icu::Locale(weekRuleLocale([](const char* name) { return std::getenv(name); }).c_str()));
  return CohortCalendar(std::move(impl));
}

CohortCalendar::CohortCalendar(std::string_view timeZoneId, std::string_view localeId) : impl_(std::make_unique<Impl>()) {
  auto* zone = icu::TimeZone::createTimeZone(icu::UnicodeString::fromUTF8(icu::StringPiece(timeZoneId.data(),
                                                                                          static_cast<int32_t>(timeZoneId.size()))));
  impl_->calendar = makeGregorian(zone, icu::Locale(std::string(localeId).c_str()));
}

CohortCalendar::CohortCalendar(const CohortCalendar& other) : impl_(std::make_unique<Impl>()) {
  if (other.impl_->calendar) impl_->calendar.reset(other.impl_->calendar->clone());
}

CohortCalendar& CohortCalendar::operator=(const CohortCalendar& other) {
  if (this != &other) {
    impl_->calendar.reset(other.impl_->calendar ? other.impl_->calendar->clone() : nullptr);
  }
  return *this;
}

CohortCalendar::~CohortCalendar() = default;

std::optional<DateInterval> CohortCalendar::containingCaptureRange(FlushFrequency frequency, SystemTime date) const {
  if (!impl_->calendar) return std::nullopt;
  auto& cal = *impl_->calendar;
  UErrorCode status = U_ZERO_ERROR;
  UDate dayStart = impl_->startOfDay(toUDate(date), status);
  UDate start = dayStart;
  UDate end = 0;
  switch (frequency) {
    case FlushFrequency::daily:
      end = impl_->startOfDay(impl_->addDays(dayStart, 1, status), status);
      break;
    case FlushFrequency::weekly: {
      cal.setTime(dayStart, status);
      int32_t weekday = cal.get(UCAL_DAY_OF_WEEK, status);
      int32_t offset = (weekday - static_cast<int32_t>(cal.getFirstDayOfWeek(status)) + 7) % 7;
      start = impl_->startOfDay(impl_->addDays(dayStart, -offset, status), status);
      end = impl_->startOfDay(impl_->addDays(start, 7, status), status);
      break;
    }
    case FlushFrequency::monthly:
      return containingMonth(date);
  }
  if (U_FAILURE(status) || !(start < end)) return std::nullopt;
  return DateInterval{fromUDate(start), fromUDate(end)};
}

std::optional<DateInterval> CohortCalendar::containingMonth(SystemTime date) const {
  if (!impl_->calendar) return std::nullopt;
  auto& cal = *impl_->calendar;
  UErrorCode status = U_ZERO_ERROR;
  cal.setTime(toUDate(date), status);
  cal.set(UCAL_DATE, 1);
  UDate first = cal.getTime(status);
  UDate start = impl_->startOfDay(first, status);
  cal.setTime(start, status);
  cal.add(UCAL_MONTH, 1, status);
  UDate end = impl_->startOfDay(cal.getTime(status), status);
  if (U_FAILURE(status) || !(start < end)) return std::nullopt;
  return DateInterval{fromUDate(start), fromUDate(end)};
}

std::optional<int64_t> CohortCalendar::wholeHours(SystemTime from, SystemTime to) const {
  if (!impl_->calendar) return std::nullopt;
  UErrorCode status = U_ZERO_ERROR;
  impl_->calendar->setTime(toUDate(from), status);
  int32_t hours = impl_->calendar->fieldDifference(toUDate(to), UCAL_HOUR_OF_DAY, status);
  if (U_FAILURE(status)) return std::nullopt;
  return hours;
}

std::optional<int64_t> CohortCalendar::wholeDays(SystemTime from, SystemTime to) const {
  if (!impl_->calendar) return std::nullopt;
  // The difference of the local dates, not of elapsed 24-hour spans: a day
  // whose midnight was skipped starts at 01:00 and is still one day.
  auto& cal = *impl_->calendar;
  UErrorCode status = U_ZERO_ERROR;
  cal.setTime(toUDate(from), status);
  const int32_t first = cal.get(UCAL_JULIAN_DAY, status);
  cal.setTime(toUDate(to), status);
  const int32_t last = cal.get(UCAL_JULIAN_DAY, status);
  if (U_FAILURE(status)) return std::nullopt;
  return int64_t{last} - first;
}

std::optional<DateInterval> CohortCalendar::periodAfter(FlushFrequency frequency, SystemTime lastEnd) const {
  auto range = containingCaptureRange(frequency, lastEnd);
  if (!range) return std::nullopt;
  // Where the zone or the week rule changed since the last period was cut,
  // its end lies inside a period of this calendar: the rest of that period
  // follows it, so no day is counted twice or skipped.
  return DateInterval{lastEnd, range->end};
}

std::optional<SystemTime> CohortCalendar::addingDays(SystemTime date, int64_t days) const {
  if (!impl_->calendar || days > INT32_MAX || days < INT32_MIN) return std::nullopt;
  UErrorCode status = U_ZERO_ERROR;
  UDate moved = impl_->addDays(toUDate(date), static_cast<int32_t>(days), status);
  if (U_FAILURE(status)) return std::nullopt;
  return fromUDate(moved);
}

std::optional<std::tuple<int32_t, int32_t, int32_t>> CohortCalendar::dayOf(SystemTime date) const {
  if (!impl_->calendar) return std::nullopt;
  auto& cal = *impl_->calendar;
  UErrorCode status = U_ZERO_ERROR;
  cal.setTime(toUDate(date), status);
  auto day = std::make_tuple(cal.get(UCAL_EXTENDED_YEAR, status), cal.get(UCAL_MONTH, status), cal.get(UCAL_DATE, status));
  if (U_FAILURE(status)) return std::nullopt;
  return day;
}

std::string CohortCalendar::timeZoneId() const {
  if (!impl_->calendar) return {};
  icu::UnicodeString id;
  impl_->calendar->getTimeZone().getID(id);
  std::string out;
  id.toUTF8String(out);
  return out;
}

std::string formatDateForLog(SystemTime date) {
  auto seconds = std::chrono::floor<std::chrono::seconds>(date.time_since_epoch()).count();
  std::time_t t = static_cast<std::time_t>(seconds);
  std::tm tm{};
  gmtime_r(&t, &tm);
  return fmt::format("{:04}-{:02}-{:02} {:02}:{:02}:{:02} +0000", tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday,
                     tm.tm_hour, tm.tm_min, tm.tm_sec);
}

}  // namespace fbf
