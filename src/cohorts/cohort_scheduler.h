// Decides when usage cohorts are due and drives their generation.
//
// For each frequency (day, week of year, month) the period that contains the
// last aggregation is due once it has ended before `today`. A due period is
// generated at once only with a probability that grows with its age, h/24 at
// h whole hours after its end, certain from 24 hours on and impossible in the
// first hour, so that devices do not all report right after a boundary. A
// device that was idle for several periods catches up one period per loop
// pass, each behind its own coin.
//
// `today` is fixed when the scheduler is made (the assembly's current date);
// the store's `lastAggregations` is the only progress marker.
//
// Lifetime and threading: made per cohort flush on the work queue;
// `doPeriodicUsageCalculations` runs synchronously on the store's context
// queue. Owns its generator; holds the store without owning it.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "cohorts/cohort_dates.h"
#include "cohorts/cohort_feedback_generator.h"
#include "cohorts/random_source.h"
#include "cohorts/usage_store.h"

#include <memory>

namespace fbf {

class CohortSchedulerProtocol {
 public:
  virtual ~CohortSchedulerProtocol() = default;
  virtual bool shouldAggregate(FlushFrequency frequency) = 0;
};

class CohortScheduler final : public CohortSchedulerProtocol {
 public:
  static constexpr int64_t kDefaultMaxAgeInHours = 24;

  // Production: `today` and `isFlushingEagerly` from the assembly, the
  // generator built from the assembly and the store, the calendar of the
  // process's time zone, the system's random device unless one is given.
  CohortScheduler(FBFAssemblyProtocol& assembly, DataStorageContainerProtocol& storageContainer,
                  std::shared_ptr<RandomSource> random = nullptr);
  CohortScheduler(DataStorageContainerProtocol& storageContainer,
                  std::unique_ptr<CohortFeedbackGeneratorProtocol> generator, SystemTime today, CohortCalendar calendar,
                  std::shared_ptr<RandomSource> random, bool isFlushingEagerly = false);

  // Aggregates every due period of day, week and month, in that order.
  void doPeriodicUsageCalculations();
  void aggregateIfNeeded(FlushFrequency frequency);
  bool shouldAggregate(FlushFrequency frequency) override;
  bool flipAgeWeightedCoin(SystemTime periodEnd);

  void setMaxAgeInHours(int64_t hours) { maxAgeInHours_ = hours; }
  SystemTime today() const { return today_; }
  bool isFlushingEagerly() const { return isFlushingEagerly_; }

 private:
  DataStorageContainerProtocol& persistentStore_;
  std::unique_ptr<CohortFeedbackGeneratorProtocol> cohortFeedbackGenerator_;
  CohortCalendar calendar_;
  std::shared_ptr<RandomSource> random_;
  bool isFlushingEagerly_;
  SystemTime today_;
  int64_t maxAgeInHours_ = kDefaultMaxAgeInHours;
};

}  // namespace fbf
