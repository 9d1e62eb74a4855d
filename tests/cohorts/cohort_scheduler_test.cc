// When cohorts are due: the period boundary, the age-weighted coin and
// catching up after idle periods, with a seeded coin and a store whose
// markers are set by hand.

#include "cohorts/cohort_scheduler.h"
#include "cohorts_test_support.h"

namespace fbf::testing {
namespace {

// Aggregates nothing; records each period it was asked for and advances the
// marker as the real generator does (unless stuck).
class RecordingGenerator final : public CohortFeedbackGeneratorProtocol {
 public:
  RecordingGenerator(DataStorageContainerProtocol& store, CohortCalendar calendar)
      : store_(store), calendar_(std::move(calendar)) {}
  void aggregateNext(FlushFrequency f) override {
    auto& marker = store_.lastAggregations()[f];
    auto range = calendar_.containingCaptureRange(f, *marker->timestamp());
    periods.emplace_back(f, *range);
    if (!stuck) marker->setTimestamp(range->end);
  }
  std::vector<DateInterval> periodsOf(FlushFrequency f) const {
    std::vector<DateInterval> out;
    for (const auto& [freq, range] : periods) {
      if (freq == f) out.push_back(range);
    }
    return out;
  }
  std::vector<std::pair<FlushFrequency, DateInterval>> periods;
  bool stuck = false;

 private:
  DataStorageContainerProtocol& store_;
  CohortCalendar calendar_;
};

// Guards against: a period aggregated before it ends or never after it, a coin that ignores the period's age, idle periods skipped or merged when catching up, or a stuck generator looping forever.
class CohortSchedule : public OpenStore {
 protected:
  CohortSchedule() : OpenStore("America/New_York") {}
  CohortScheduler& makeScheduler(SystemTime today, uint64_t seed = 1) {
    CohortCalendar calendar("America/New_York", "en_US");
    auto generator = std::make_unique<RecordingGenerator>(*store, calendar);
    recorder = generator.get();
    scheduler = std::make_unique<CohortScheduler>(*store, std::move(generator), today, calendar,
                                                  std::make_shared<SeededRandomSource>(seed));
    return *scheduler;
  }

  std::unique_ptr<CohortScheduler> scheduler;
  RecordingGenerator* recorder = nullptr;
};

TEST_F(CohortSchedule, ADayIsNeverDueInItsFirstHourAndAlwaysADayLater) {
  setMarker(FlushFrequency::daily, localTime(2030, 6, 5, 10));
  const struct {
    const char* name;
    SystemTime today;
    int64_t maxAgeInHours;
    int minDue, maxDue;  // of 200 draws
  } rows[] = {
      {"the period ends exactly today", localTime(2030, 6, 6), 24, 0, 0},
      {"one second short of an hour later", localTime(2030, 6, 6, 0, 59, 59), 24, 0, 0},
      {"12 hours later the coin weighs the age", localTime(2030, 6, 6, 12), 24, 40, 160},
      {"24 hours later", localTime(2030, 6, 7), 24, 200, 200},
      {"no maximum age", localTime(2030, 6, 6, 0, 0, 1), 0, 200, 200},
      {"no maximum age, the period ends exactly today", localTime(2030, 6, 6), 0, 0, 0},
      {"a negative maximum age", localTime(2030, 6, 6, 0, 0, 1), -5, 200, 200},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    makeScheduler(row.today).setMaxAgeInHours(row.maxAgeInHours);
    int due = 0;
    on([&] {
      for (int draw = 0; draw < 200; ++draw) due += scheduler->shouldAggregate(FlushFrequency::daily) ? 1 : 0;
    });
    EXPECT_GE(due, row.minDue);
    EXPECT_LE(due, row.maxDue);
  }
  on([&] { store->lastAggregations().erase(FlushFrequency::weekly); });
  makeScheduler(localTime(2040, 1, 1));
  on([&] {
    EXPECT_FALSE(scheduler->shouldAggregate(FlushFrequency::weekly))
        << "a frequency without a marker";
  });
}

TEST_F(CohortSchedule, CatchingUpCoversLeapFebruaryAndTheWeekAcrossNewYear) {
  setAllMarkers(localTime(2028, 1, 15));
  makeScheduler(localTime(2028, 4, 10)).doPeriodicUsageCalculations();
  auto months = recorder->periodsOf(FlushFrequency::monthly);
  ASSERT_EQ(months.size(), 3u);
  EXPECT_EQ(months[1], (DateInterval{localTime(2028, 2, 1), localTime(2028, 3, 1)}));
  EXPECT_EQ(months[2].start, localTime(2028, 3, 1));

  setAllMarkers(localTime(2030, 12, 30, 9));
  makeScheduler(localTime(2031, 1, 10)).doPeriodicUsageCalculations();
  auto weeks = recorder->periodsOf(FlushFrequency::weekly);
  ASSERT_EQ(weeks.size(), 1u);
  EXPECT_EQ(weeks[0], (DateInterval{localTime(2030, 12, 29), localTime(2031, 1, 5)}));
  EXPECT_EQ(recorder->periodsOf(FlushFrequency::monthly).size(), 1u);
}

TEST_F(CohortSchedule, AGeneratorThatDoesNotAdvanceStopsThePassWithAnError) {
  setAllMarkers(localTime(2030, 6, 1));
  auto& scheduler = makeScheduler(localTime(2030, 7, 10));
  recorder->stuck = true;
  LogCapture logs;
  scheduler.doPeriodicUsageCalculations();
  EXPECT_EQ(recorder->periods.size(), 3u) << "one attempt per frequency";
  EXPECT_EQ(logs.count("did not advance frequency"), 3u);
}

}  // namespace
}  // namespace fbf::testing
