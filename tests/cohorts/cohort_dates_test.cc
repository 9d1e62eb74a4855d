// Capture ranges and calendar arithmetic across the awkward dates.

#include "cohorts/cohort_dates.h"
#include "cohorts_test_support.h"

#include <gtest/gtest.h>

#include <array>
#include <map>

namespace fbf::testing {
namespace {

SystemTime at(const std::array<int, 4>& d) { return localTime(d[0], d[1], d[2], d[3]); }

// Guards against: a capture range that starts or ends off local midnight, has the wrong length across a daylight-saving change or a leap month, or a week that ignores its locale's rule.
TEST(CaptureRanges, StartAndEndAtLocalMidnightsAndCountCalendarDays) {
  const struct {
    const char* name;
    const char *zone, *locale;
    FlushFrequency frequency;
    std::array<int, 4> when, start, end;  // year, month, day, hour
    int64_t days, hours;
  } rows[] = {
      {"a plain day", "America/New_York", "en_US", FlushFrequency::daily, {2030, 6, 1, 0}, {2030, 6, 1, 0},
       {2030, 6, 2, 0}, 1, 24},
      {"the spring-forward day", "America/New_York", "en_US", FlushFrequency::daily, {2030, 3, 10, 15},
       {2030, 3, 10, 0}, {2030, 3, 11, 0}, 1, 23},
      {"the fall-back day", "America/New_York", "en_US", FlushFrequency::daily, {2030, 11, 3, 1}, {2030, 11, 3, 0},
       {2030, 11, 4, 0}, 1, 25},
      {"leap February", "America/New_York", "en_US", FlushFrequency::monthly, {2028, 2, 29, 23}, {2028, 2, 1, 0},
       {2028, 3, 1, 0}, 29, 29 * 24},
      {"plain February", "America/New_York", "en_US", FlushFrequency::monthly, {2029, 2, 14, 0}, {2029, 2, 1, 0},
       {2029, 3, 1, 0}, 28, 28 * 24},
      {"a month across the spring forward", "America/New_York", "en_US", FlushFrequency::monthly, {2030, 3, 20, 0},
       {2030, 3, 1, 0}, {2030, 4, 1, 0}, 31, 31 * 24 - 1},
      {"a Sunday week across the fall back", "America/New_York", "en_US", FlushFrequency::weekly, {2030, 11, 5, 0},
       {2030, 11, 3, 0}, {2030, 11, 10, 0}, 7, 7 * 24 + 1},
      // ISO weeks (Monday, 4 days) in Germany.
      {"ISO week 53 in its first year", "Europe/Berlin", "de_DE", FlushFrequency::weekly, {2020, 12, 31, 12},
       {2020, 12, 28, 0}, {2021, 1, 4, 0}, 7, 7 * 24},
      {"ISO week 53 in its second year", "Europe/Berlin", "de_DE", FlushFrequency::weekly, {2021, 1, 3, 23},
       {2020, 12, 28, 0}, {2021, 1, 4, 0}, 7, 7 * 24},
      {"ISO week 1 after it", "Europe/Berlin", "de_DE", FlushFrequency::weekly, {2021, 1, 4, 0}, {2021, 1, 4, 0},
       {2021, 1, 11, 0}, 7, 7 * 24},
      // Sunday weeks with week 1 holding 1 January in the US.
      {"US week 53", "America/Chicago", "en_US", FlushFrequency::weekly, {2016, 12, 31, 22}, {2016, 12, 25, 0},
       {2017, 1, 1, 0}, 7, 7 * 24},
      {"US week 1", "America/Chicago", "en_US", FlushFrequency::weekly, {2017, 1, 1, 0}, {2017, 1, 1, 0},
       {2017, 1, 8, 0}, 7, 7 * 24},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    ScopedTimeZone zone(row.zone);
    CohortCalendar calendar(row.zone, row.locale);
    auto range = calendar.containingCaptureRange(row.frequency, at(row.when));
    ASSERT_TRUE(range);
    EXPECT_EQ(range->start, at(row.start));
    EXPECT_EQ(range->end, at(row.end));
    EXPECT_EQ(calendar.wholeDays(range->start, range->end), row.days);
    EXPECT_EQ(calendar.wholeHours(range->start, range->end), row.hours);
    EXPECT_EQ(range->end - range->start, hours(row.hours));
  }
}

// Guards against: the process time zone ignored, lookback days counted as 24-hour spans, or distinct days counted in UTC.
TEST(NewYorkCalendar, DaysAreLocalCalendarDaysOfTheProcessTimeZone) {
  ScopedTimeZone zone("America/New_York");
  CohortCalendar calendar = CohortCalendar::current();
  EXPECT_EQ(calendar.timeZoneId(), "America/New_York");
  EXPECT_EQ(calendar.addingDays(localTime(2030, 4, 1), -56), localTime(2030, 2, 4));
  EXPECT_EQ(calendar.addingDays(localTime(2030, 3, 11), -1), localTime(2030, 3, 10));
  // 23:30 and 00:30 local are different days although 1 hour apart.
  auto late = calendar.dayOf(localTime(2030, 7, 4, 23, 30));
  ASSERT_TRUE(late);
  EXPECT_NE(*late, calendar.dayOf(localTime(2030, 7, 5, 0, 30)));
  EXPECT_EQ(*late, calendar.dayOf(localTime(2030, 7, 4, 0, 0)));
  ScopedTimeZone tokyo("Asia/Tokyo");
  EXPECT_EQ(CohortCalendar::current().timeZoneId(), "Asia/Tokyo");
  EXPECT_EQ(formatDateForLog(utcTime(2030, 1, 2, 3, 4, 5)), "2030-01-02 03:04:05 +0000") << "logs are in UTC";
}

// Guards against: the week rule taken from the wrong locale variable.
TEST(WeekRuleLocale, FollowsPosixPrecedence) {
  struct Row {
    std::map<std::string, std::string> env;
    const char* locale;
    int32_t firstWeekday;  // of the calendar made with it; 1 Sunday, 2 Monday
  };
  const Row rows[] = {
      {{}, "en_US_POSIX", 1},
      {{{"LANG", "C"}}, "en_US_POSIX", 1},
      {{{"LANG", "en_GB.UTF-8"}}, "en_GB", 2},
      {{{"LANG", "en_US.UTF-8"}, {"LC_TIME", "de_DE.UTF-8@euro"}}, "de_DE", 2},
      {{{"LANG", "en_GB.UTF-8"}, {"LC_TIME", "en_US.UTF-8"}, {"LC_ALL", "POSIX"}}, "en_US_POSIX", 1},
      {{{"LANG", "en_US.UTF-8"}, {"LC_TIME", ""}, {"LC_ALL", ""}}, "en_US", 1},
  };
  for (const auto& row : rows) {
    const std::string locale = CohortCalendar::weekRuleLocale([&](const char* name) -> const char* {
      auto it = row.env.find(name);
      return it == row.env.end() ? nullptr : it->second.c_str();
    });
    EXPECT_EQ(locale, row.locale);
    // 2030-06-05 is a Wednesday; the week starts on its locale's first day.
    auto week = CohortCalendar("UTC", locale).containingCaptureRange(FlushFrequency::weekly, utcTime(2030, 6, 5, 12));
    ASSERT_TRUE(week) << locale;
    EXPECT_EQ(week->start, utcTime(2030, 6, row.firstWeekday == 1 ? 2 : 3)) << locale;
  }
}

// Guards against: periods that overlap or leave a gap when two runs of the daemon see a different zone or week rule, or where a transition skips midnight.
TEST(PeriodsAcrossRuns, ChainWithoutOverlapOrGapAndCountCalendarDays) {
  using F = FlushFrequency;
  struct Row {
    const char* name;
    const char *zone1, *locale1, *zone2, *locale2;
    FlushFrequency frequency;
    int year, month, day;         // a date of the first run's period, at noon in zone1
    std::array<int64_t, 3> days;  // whole days of the first, second and third period
  };
  const Row rows[] = {
      {"Monday weeks, then Sunday weeks", "Europe/London", "en_GB", "Europe/London", "en_US", F::weekly, 2030, 6, 5,
       {7, 6, 7}},
      {"Sunday weeks, then Monday weeks", "America/Chicago", "en_US", "America/Chicago", "de_DE", F::weekly, 2030, 6,
       5, {7, 1, 7}},
      {"New York days, then Tokyo days", "America/New_York", "en_US", "Asia/Tokyo", "ja_JP", F::daily, 2030, 6, 5,
       {1, 1, 1}},
      {"Sao Paulo skips the midnight of 4 November 2018", "America/Sao_Paulo", "pt_BR", "America/Sao_Paulo", "pt_BR",
       F::daily, 2018, 11, 3, {1, 1, 1}},
      {"Santiago skips the midnight starting the week of 8 September 2030", "America/Santiago", "en_US",
       "America/Santiago", "en_US", F::weekly, 2030, 9, 4, {7, 7, 7}},
      {"Havana skips the midnight of 10 March 2030", "America/Havana", "es_CU", "America/Havana", "es_CU", F::daily,
       2030, 3, 9, {1, 1, 1}},
      {"Beirut skips the midnight starting the week of 31 March 2030", "Asia/Beirut", "en_US", "Asia/Beirut", "en_US",
       F::weekly, 2030, 3, 27, {7, 7, 7}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::optional<DateInterval> first;
    {
      ScopedTimeZone zone(row.zone1);
      CohortCalendar calendar(row.zone1, row.locale1);
      first = calendar.containingCaptureRange(row.frequency, localTime(row.year, row.month, row.day, 12));
      ASSERT_TRUE(first);
      EXPECT_EQ(calendar.wholeDays(first->start, first->end), row.days[0]);
    }
    CohortCalendar calendar(row.zone2, row.locale2);
    auto second = calendar.periodAfter(row.frequency, first->end);
    ASSERT_TRUE(second);
    auto third = calendar.periodAfter(row.frequency, second->end);
    ASSERT_TRUE(third);
    EXPECT_EQ(second->start, first->end);
    EXPECT_EQ(third->start, second->end);
    EXPECT_EQ(calendar.wholeDays(second->start, second->end), row.days[1]);
    EXPECT_EQ(calendar.wholeDays(third->start, third->end), row.days[2]);
    // Once the calendar is steady, a period is exactly its capture range.
    EXPECT_EQ(calendar.containingCaptureRange(row.frequency, third->start), third);
  }
}

}  // namespace
}  // namespace fbf::testing
