#include "cohorts/cohort_scheduler.h"

#include "platform/logging.h"

namespace fbf {

CohortScheduler::CohortScheduler(FBFAssemblyProtocol& assembly, DataStorageContainerProtocol& storageContainer,
                                 std::shared_ptr<RandomSource> random)
    : persistentStore_(storageContainer),
      calendar_(CohortCalendar::current()),
      random_(random ? std::move(random) : makeSystemRandomSource()),
      isFlushingEagerly_(assembly.isFlushingEagerly()),
      today_(assembly.currentDate()) {
  cohortFeedbackGenerator_ = std::make_unique<CohortFeedbackGenerator>(assembly, storageContainer, random_, calendar_);
}

CohortScheduler::CohortScheduler(DataStorageContainerProtocol& storageContainer,
                                 std::unique_ptr<CohortFeedbackGeneratorProtocol> generator, SystemTime today,
                                 CohortCalendar calendar, std::shared_ptr<RandomSource> random, bool isFlushingEagerly)
    : persistentStore_(storageContainer),
      cohortFeedbackGenerator_(std::move(generator)),
      calendar_(std::move(calendar)),
      random_(random ? std::move(random) : makeSystemRandomSource()),
      isFlushingEagerly_(isFlushingEagerly),
      today_(today) {}

void CohortScheduler::doPeriodicUsageCalculations() {
  persistentStore_.managedObjectContext().performAndWait([this] {
    for (auto frequency : kAllFlushFrequencies) aggregateIfNeeded(frequency);
  });
}

void CohortScheduler::aggregateIfNeeded(FlushFrequency frequency) {
  auto& aggregations = persistentStore_.lastAggregations();
  while (shouldAggregate(frequency)) {
    auto before = aggregations[frequency] ? aggregations[frequency]->timestamp() : std::nullopt;
    cohortFeedbackGenerator_->aggregateNext(frequency);
    auto it = aggregations.find(frequency);
    auto after = it != aggregations.end() && it->second ? it->second->timestamp() : std::nullopt;
    // A generator that did not move the marker would loop forever.
    if (!after || after == before) {
      logging::get("CohortScheduler")
          .error("The cohort generator did not advance frequency {}; stopping this pass.", rawValue(frequency));
      return;
    }
  }
}

bool CohortScheduler::shouldAggregate(FlushFrequency frequency) {
  auto& aggregations = persistentStore_.lastAggregations();
  auto it = aggregations.find(frequency);
  if (it == aggregations.end() || !it->second) return false;
  auto timestamp = it->second->timestamp();
  if (!timestamp) return false;
  auto range = calendar_.containingCaptureRange(frequency, *timestamp);
  if (!range) return false;
  if (!(range->end < today_)) return false;
  return flipAgeWeightedCoin(range->end);
}

bool CohortScheduler::flipAgeWeightedCoin(SystemTime periodEnd) {
  if (maxAgeInHours_ < 1) return true;
  auto hours = calendar_.wholeHours(periodEnd, today_);
  if (!hours) return true;
  auto r = random_->uniformBelow(static_cast<uint64_t>(maxAgeInHours_));
  return static_cast<int64_t>(r) < *hours;
}

}  // namespace fbf
