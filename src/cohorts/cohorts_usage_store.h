// The usage cohorts as one flush uses them: the usage event store brought up
// for the flush, usage counting per processed session, the cohort flush at
// the end of the walk, and the row-cache reset when the flush goes away.
//
// Lifetime and threading: made by the flush on the work queue and called
// from there; each call hops synchronously onto the store's own queue (the
// purge is queued there and runs after the call returns). Owns the store.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "cohorts/cohort_dates.h"
#include "cohorts/object_graph_storage_container.h"
#include "cohorts/random_source.h"
#include "cohorts/usage_processor.h"
#include "flushing/feedback_flusher.h"

#include <memory>

namespace fbf {

class CohortsUsageStore final : public FlushUsageStore {
 public:
  // Null when the store cannot be brought up (then nothing is counted and no
  // cohorts are generated). `random` drives the scheduler's coin and the
  // envelopes' UUIDs (the system's random device when null).
  static std::unique_ptr<CohortsUsageStore> make(FBFAssemblyProtocol& assembly,
                                                 std::shared_ptr<RandomSource> random = nullptr,
                                                 ObjectGraphStorageContainer::Options options = {});
  CohortsUsageStore(FBFAssemblyProtocol& assembly, std::unique_ptr<DataStorageContainerProtocol> store,
                    std::shared_ptr<RandomSource> random);

  // Counts each session handed to it (before it is rewritten for upload).
  UsageEventSink* usageEventSink() override { return &usageProcessor_; }
  // Aggregates every due day, week and month into "Usage" files, then queues
  // the purge of the records no period still needs (see `purgeCutoff`).
  void flushCohortsFeedback() override;
  // Drops cached records and unsaved changes (the caller logs it).
  void resetRowCache() override { store_->emptyRowCache(); }

  // Records stamped at or before the returned date are purged: the earlier
  // of `today` minus the lookback and just before the start of any period
  // (or monthly lookback) that is still to be aggregated. Context queue only.
  SystemTime purgeCutoff(SystemTime today, int64_t lookbackInDays, const CohortCalendar& calendar);

  DataStorageContainerProtocol& store() { return *store_; }
  UsageProcessor& usageProcessor() { return usageProcessor_; }

 private:
  FBFAssemblyProtocol& assembly_;
  std::unique_ptr<DataStorageContainerProtocol> store_;
  std::shared_ptr<RandomSource> random_;
  UsageProcessor usageProcessor_;
};

}  // namespace fbf
