// Capture ranges and calendar arithmetic across the awkward dates.

#include "cohorts/cohort_dates.h"
#include "cohorts_test_support.h"

#include <gtest/gtest.h>

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

TEST(LogDates, AreUtcWithOffset) { EXPECT_EQ(formatDateForLog(utcTime(2030, 1, 2, 3, 4, 5)), "2030-01-02 03:04:05 +0000"); }

}  // namespace
}  // namespace fbf::testing
