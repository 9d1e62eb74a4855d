#include "cohorts/cohorts_usage_store.h"

#include "cohorts/cohort_scheduler.h"

#include <algorithm>

namespace fbf {

std::unique_ptr<CohortsUsageStore> CohortsUsageStore::make(FBFAssemblyProtocol& assembly,
                                                           std::shared_ptr<RandomSource> random,
                                                           ObjectGraphStorageContainer::Options options) {
  auto store = ObjectGraphStorageContainer::make(assembly, std::move(options));
  if (!store) return nullptr;
  return std::make_unique<CohortsUsageStore>(assembly, std::move(store), std::move(random));
}

CohortsUsageStore::CohortsUsageStore(FBFAssemblyProtocol& assembly, std::unique_ptr<DataStorageContainerProtocol> store,
                                     std::shared_ptr<RandomSource> random)
    : assembly_(assembly),
      store_(std::move(store)),
      random_(random ? std::move(random) : makeSystemRandomSource()),
      usageProcessor_(*store_) {}

void CohortsUsageStore::flushCohortsFeedback() {
  usageProcessor_.writePending();
  CohortScheduler scheduler(assembly_, *store_, random_);
  scheduler.doPeriodicUsageCalculations();
  int64_t lookback = CohortFeedbackGenerator::cohortsLookbackInDays(assembly_.cachedBag());
  auto calendar = CohortCalendar::current();
  SystemTime cutoff;
  store_->managedObjectContext().performAndWait([&] { cutoff = purgeCutoff(scheduler.today(), lookback, calendar); });
  store_->purgeEventsOlderThan(cutoff);
}

SystemTime CohortsUsageStore::purgeCutoff(SystemTime today, int64_t lookback, const CohortCalendar& calendar) {
  SystemTime cutoff = calendar.addingDays(today, -lookback).value_or(today - std::chrono::hours(24 * lookback));
  // A period still waiting for its coin needs its records, and so does the
  // lookback of a month still to be aggregated.
  SystemTime keepFrom = cutoff + std::chrono::milliseconds(1);
  for (const auto& [frequency, event] : store_->lastAggregations()) {
    auto timestamp = event ? event->timestamp() : std::nullopt;
    if (!timestamp) continue;
    if (auto range = calendar.containingCaptureRange(frequency, *timestamp)) keepFrom = std::min(keepFrom, range->start);
    if (frequency == FlushFrequency::monthly) {
      if (auto month = calendar.containingMonth(*timestamp)) {
        if (auto start = calendar.addingDays(month->end, -lookback)) keepFrom = std::min(keepFrom, *start);
      }
    }
  }
  return keepFrom - std::chrono::milliseconds(1);
}

}  // namespace fbf
