// Capture ranges and calendar arithmetic across the awkward dates.

#include "cohorts/cohort_dates.h"
#include "cohorts_test_support.h"

#include <gtest/gtest.h>

#include <array>
#include <map>

namespace fbf::testing {
namespace {

class NewYorkCalendar : public ::testing::Test {
 protected:
  ScopedTimeZone zone{"America/New_York"};
  CohortCalendar calendar = CohortCalendar::current();
};

TEST_F(NewYorkCalendar, TheProcessTimeZoneIsHonoured) {
  EXPECT_EQ(calendar.timeZoneId(), "America/New_York");
  ScopedTimeZone tokyo("Asia/Tokyo");
  EXPECT_EQ(CohortCalendar::current().timeZoneId(), "Asia/Tokyo");
}

TEST_F(NewYorkCalendar, TheSpringForwardDayHas23Hours) {
  auto range = calendar.containingCaptureRange(FlushFrequency::daily, localTime(2030, 3, 10, 15));
  ASSERT_TRUE(range);
  EXPECT_EQ(range->start, localTime(2030, 3, 10));
  EXPECT_EQ(range->end, localTime(2030, 3, 11));
  EXPECT_EQ(range->end - range->start, hours(23));
  EXPECT_EQ(calendar.wholeDays(range->start, range->end), 1);
  EXPECT_EQ(calendar.wholeHours(range->start, range->end), 23);
}

TEST_F(NewYorkCalendar, TheFallBackDayHas25Hours) {
  auto range = calendar.containingCaptureRange(FlushFrequency::daily, localTime(2030, 11, 3, 1, 30));
  ASSERT_TRUE(range);
  EXPECT_EQ(range->start, localTime(2030, 11, 3));
  EXPECT_EQ(range->end - range->start, hours(25));
  EXPECT_EQ(calendar.wholeDays(range->start, range->end), 1);
}

TEST_F(NewYorkCalendar, ADayRangeIncludesItsStartAndNotItsEnd) {
  auto range = calendar.containingCaptureRange(FlushFrequency::daily, localTime(2030, 6, 1));
  ASSERT_TRUE(range);
  EXPECT_EQ(range->start, localTime(2030, 6, 1));
  auto next = calendar.containingCaptureRange(FlushFrequency::daily, range->end);
  ASSERT_TRUE(next);
  EXPECT_EQ(next->start, range->end);
}

TEST_F(NewYorkCalendar, LeapFebruaryHas29Days) {
  auto leap = calendar.containingCaptureRange(FlushFrequency::monthly, localTime(2028, 2, 29, 23, 59));
  ASSERT_TRUE(leap);
  EXPECT_EQ(leap->start, localTime(2028, 2, 1));
  EXPECT_EQ(leap->end, localTime(2028, 3, 1));
  EXPECT_EQ(calendar.wholeDays(leap->start, leap->end), 29);
  auto plain = calendar.containingCaptureRange(FlushFrequency::monthly, localTime(2029, 2, 14));
  ASSERT_TRUE(plain);
  EXPECT_EQ(calendar.wholeDays(plain->start, plain->end), 28);
}

TEST_F(NewYorkCalendar, AMonthAcrossTheSpringForwardStartsAndEndsAtMidnight) {
  auto march = calendar.containingCaptureRange(FlushFrequency::monthly, localTime(2030, 3, 20));
  ASSERT_TRUE(march);
  EXPECT_EQ(march->start, localTime(2030, 3, 1));
  EXPECT_EQ(march->end, localTime(2030, 4, 1));
  EXPECT_EQ(march->end - march->start, hours(31 * 24 - 1));
}

TEST_F(NewYorkCalendar, LookbackDaysAreCalendarDays) {
  EXPECT_EQ(calendar.addingDays(localTime(2030, 4, 1), -56), localTime(2030, 2, 4));
  EXPECT_EQ(calendar.addingDays(localTime(2030, 3, 11), -1), localTime(2030, 3, 10));
}

TEST_F(NewYorkCalendar, DistinctDaysAreLocalDays) {
  // 23:30 and 00:30 local are different days although 1 hour apart.
  auto late = calendar.dayOf(localTime(2030, 7, 4, 23, 30));
  auto early = calendar.dayOf(localTime(2030, 7, 5, 0, 30));
  ASSERT_TRUE(late && early);
  EXPECT_NE(*late, *early);
  EXPECT_EQ(*late, calendar.dayOf(localTime(2030, 7, 4, 0, 0)));
}

// Weeks follow the locale: ISO weeks (Monday, 4 days) in Germany, Sunday
// weeks with week 1 holding 1 January in the US.
TEST(WeekOfYear, IsoWeek53SpansTheYearBoundary) {
  ScopedTimeZone zone("Europe/Berlin");
  CohortCalendar calendar("Europe/Berlin", "de_DE");
  auto week = calendar.containingCaptureRange(FlushFrequency::weekly, localTime(2020, 12, 31, 12));
  ASSERT_TRUE(week);
  EXPECT_EQ(week->start, localTime(2020, 12, 28));
  EXPECT_EQ(week->end, localTime(2021, 1, 4));
  auto sameWeek = calendar.containingCaptureRange(FlushFrequency::weekly, localTime(2021, 1, 3, 23));
  EXPECT_EQ(sameWeek, week);
  auto week1 = calendar.containingCaptureRange(FlushFrequency::weekly, localTime(2021, 1, 4));
  ASSERT_TRUE(week1);
  EXPECT_EQ(week1->start, week->end);
  EXPECT_EQ(calendar.wholeDays(week->start, week->end), 7);
}

TEST(WeekOfYear, UsWeek53EndsTheYearAndWeek1StartsTheNext) {
  ScopedTimeZone zone("America/Chicago");
  CohortCalendar calendar("America/Chicago", "en_US");
  auto week53 = calendar.containingCaptureRange(FlushFrequency::weekly, localTime(2016, 12, 31, 22));
  ASSERT_TRUE(week53);
  EXPECT_EQ(week53->start, localTime(2016, 12, 25));
  EXPECT_EQ(week53->end, localTime(2017, 1, 1));
  auto week1 = calendar.containingCaptureRange(FlushFrequency::weekly, localTime(2017, 1, 1));
  ASSERT_TRUE(week1);
  EXPECT_EQ(week1->start, localTime(2017, 1, 1));
  EXPECT_EQ(week1->end, localTime(2017, 1, 8));
}

TEST(WeekOfYear, AWeekAcrossADaylightSavingChangeIsSevenCalendarDays) {
  ScopedTimeZone zone("America/New_York");
  CohortCalendar calendar("America/New_York", "en_US");
  auto week = calendar.containingCaptureRange(FlushFrequency::weekly, localTime(2030, 11, 5));
  ASSERT_TRUE(week);
  EXPECT_EQ(week->start, localTime(2030, 11, 3));
  EXPECT_EQ(week->end - week->start, hours(7 * 24 + 1));
  EXPECT_EQ(calendar.wholeDays(week->start, week->end), 7);
}

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

// Two runs of the daemon that see a different zone or week rule, and zones
// where a transition skips midnight: periods follow one another without
// overlap or gap, and whole days are calendar days.
TEST(PeriodsAcrossRuns, ChainWithoutOverlapOrGapAndCountCalendarDays) {
  struct Row {
    const char* name;
    const char* zone1;
    const char* locale1;
    const char* zone2;
    const char* locale2;
    FlushFrequency frequency;
    int year, month, day;  // a date of the first run's period, at noon in zone1
    std::array<int64_t, 3> days;  // whole days of the first, second and third period
  };
  const Row rows[] = {
      {"Monday weeks, then Sunday weeks", "Europe/London", "en_GB", "Europe/London", "en_US", FlushFrequency::weekly,
       2030, 6, 5, {7, 6, 7}},
      {"Sunday weeks, then Monday weeks", "America/Chicago", "en_US", "America/Chicago", "de_DE",
       FlushFrequency::weekly, 2030, 6, 5, {7, 1, 7}},
      {"New York days, then Tokyo days", "America/New_York", "en_US", "Asia/Tokyo", "ja_JP", FlushFrequency::daily,
       2030, 6, 5, {1, 1, 1}},
      {"Sao Paulo skips the midnight of 4 November 2018", "America/Sao_Paulo", "pt_BR", "America/Sao_Paulo", "pt_BR",
       FlushFrequency::daily, 2018, 11, 3, {1, 1, 1}},
      {"Santiago skips the midnight starting the week of 8 September 2030", "America/Santiago", "en_US",
       "America/Santiago", "en_US", FlushFrequency::weekly, 2030, 9, 4, {7, 7, 7}},
      {"Havana skips the midnight of 10 March 2030", "America/Havana", "es_CU", "America/Havana", "es_CU",
       FlushFrequency::daily, 2030, 3, 9, {1, 1, 1}},
      {"Beirut skips the midnight starting the week of 31 March 2030", "Asia/Beirut", "en_US", "Asia/Beirut",
       "en_US", FlushFrequency::weekly, 2030, 3, 27, {7, 7, 7}},
  };
  for (const auto& row : rows) {
    std::optional<DateInterval> first;
    {
      ScopedTimeZone zone(row.zone1);
      CohortCalendar calendar(row.zone1, row.locale1);
      first = calendar.containingCaptureRange(row.frequency, localTime(row.year, row.month, row.day, 12));
      ASSERT_TRUE(first) << row.name;
      EXPECT_EQ(calendar.wholeDays(first->start, first->end), row.days[0]) << row.name;
    }
    CohortCalendar calendar(row.zone2, row.locale2);
    auto second = calendar.periodAfter(row.frequency, first->end);
    ASSERT_TRUE(second) << row.name;
    auto third = calendar.periodAfter(row.frequency, second->end);
    ASSERT_TRUE(third) << row.name;
    EXPECT_EQ(second->start, first->end) << row.name;
    EXPECT_EQ(third->start, second->end) << row.name;
    EXPECT_EQ(calendar.wholeDays(second->start, second->end), row.days[1]) << row.name;
    EXPECT_EQ(calendar.wholeDays(third->start, third->end), row.days[2]) << row.name;
    // Once the calendar is steady, a period is exactly its capture range.
    EXPECT_EQ(calendar.containingCaptureRange(row.frequency, third->start), third) << row.name;
  }
}

TEST(LogDates, AreUtcWithOffset) { EXPECT_EQ(formatDateForLog(utcTime(2030, 1, 2, 3, 4, 5)), "2030-01-02 03:04:05 +0000"); }

}  // namespace
}  // namespace fbf::testing
