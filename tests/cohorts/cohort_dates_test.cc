// Capture ranges and calendar arithmetic across the awkward dates.

#include "cohorts/cohort_dates.h"
#include "cohorts_test_support.h"

#include <array>

namespace fbf::testing {
namespace {

struct Place {
  const char *zone, *locale;
};
const Place kNewYork{"America/New_York", "en_US"}, kBerlin{"Europe/Berlin", "de_DE"},
    kChicago{"America/Chicago", "en_US"};

// Guards against: a capture range that starts or ends off local midnight, has the wrong length across a daylight-saving change or a leap month, or a week that ignores its locale's rule (ISO weeks in Germany, Sunday weeks with week 1 holding 1 January in the US).
TEST(CaptureRanges, StartAndEndAtLocalMidnightsAndCountCalendarDays) {
  using F = FlushFrequency;
  const struct {
    const char* name;
    Place place;
    FlushFrequency frequency;
    std::array<int, 4> when;  // year, month, day, hour
    std::array<int, 3> start, end;
    int64_t days, hours;
  } rows[] = {
      {"a plain day", kNewYork, F::daily, {2030, 6, 1, 0}, {2030, 6, 1}, {2030, 6, 2}, 1, 24},
      {"the spring-forward day", kNewYork, F::daily, {2030, 3, 10, 15}, {2030, 3, 10}, {2030, 3, 11}, 1, 23},
      {"the fall-back day", kNewYork, F::daily, {2030, 11, 3, 1}, {2030, 11, 3}, {2030, 11, 4}, 1, 25},
      {"leap February", kNewYork, F::monthly, {2028, 2, 29, 23}, {2028, 2, 1}, {2028, 3, 1}, 29, 29 * 24},
      {"a month across the spring forward", kNewYork, F::monthly, {2030, 3, 20, 0}, {2030, 3, 1}, {2030, 4, 1}, 31,
       31 * 24 - 1},
      {"a week across the fall back", kNewYork, F::weekly, {2030, 11, 5, 0}, {2030, 11, 3}, {2030, 11, 10}, 7, 169},
      {"ISO week 53 in its second year", kBerlin, F::weekly, {2021, 1, 3, 23}, {2020, 12, 28}, {2021, 1, 4}, 7, 168},
      {"ISO week 1 after it", kBerlin, F::weekly, {2021, 1, 4, 0}, {2021, 1, 4}, {2021, 1, 11}, 7, 168},
      {"US week 53", kChicago, F::weekly, {2016, 12, 31, 22}, {2016, 12, 25}, {2017, 1, 1}, 7, 168},
      {"US week 1", kChicago, F::weekly, {2017, 1, 1, 0}, {2017, 1, 1}, {2017, 1, 8}, 7, 168},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    ScopedTimeZone zone(row.place.zone);
    CohortCalendar calendar(row.place.zone, row.place.locale);
    auto range = calendar.containingCaptureRange(row.frequency, localTime(row.when[0], row.when[1], row.when[2], row.when[3]));
    ASSERT_TRUE(range);
    EXPECT_EQ(range->start, localTime(row.start[0], row.start[1], row.start[2]));
    EXPECT_EQ(range->end, localTime(row.end[0], row.end[1], row.end[2]));
    EXPECT_EQ(calendar.wholeDays(range->start, range->end), row.days);
    EXPECT_EQ(calendar.wholeHours(range->start, range->end), row.hours);
    EXPECT_EQ(range->end - range->start, hours(row.hours));
  }
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
    Place first, second;
    FlushFrequency frequency;
    int year, month, day;         // a date of the first run's period, at noon in its zone
    std::array<int64_t, 3> days;  // whole days of the first, second and third period
  };
  const Place chicagoDe{"America/Chicago", "de_DE"}, tokyo{"Asia/Tokyo", "ja_JP"},
      saoPaulo{"America/Sao_Paulo", "pt_BR"}, santiago{"America/Santiago", "en_US"};
  const Row rows[] = {
      {"Sunday weeks, then Monday weeks", kChicago, chicagoDe, F::weekly, 2030, 6, 5, {7, 1, 7}},
      {"New York days, then Tokyo days", kNewYork, tokyo, F::daily, 2030, 6, 5, {1, 1, 1}},
      {"Sao Paulo skips the midnight of 4 November 2018", saoPaulo, saoPaulo, F::daily, 2018, 11, 3, {1, 1, 1}},
      {"Santiago skips the midnight starting the week of 8 September", santiago, santiago, F::weekly, 2030, 9, 4,
       {7, 7, 7}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::optional<DateInterval> first;
    {
      ScopedTimeZone zone(row.first.zone);
      CohortCalendar calendar(row.first.zone, row.first.locale);
      first = calendar.containingCaptureRange(row.frequency, localTime(row.year, row.month, row.day, 12));
      ASSERT_TRUE(first);
      EXPECT_EQ(calendar.wholeDays(first->start, first->end), row.days[0]);
    }
    CohortCalendar calendar(row.second.zone, row.second.locale);
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
