// Turns the usage event store into cohort feedback.
//
// For each aggregated calendar period it builds one usage envelope per
// supported surface (2, 1, 4, 3, in that order) stating on how many distinct
// local calendar days the surface was used; at the end of each monthly
// period it also builds the usage envelopes and one propensity envelope over
// the lookback period ending with that month.
//
// Every envelope is written as a custom feedback file of type "Usage"
// (CustomFeedback/Usage/cohorts.<UUID>.pb, owner-only) holding one serialised
// CVCohortsFeedback: kind 1 (usageEnvelope) or kind 6 (propensityEnvelope).
// The next flush uploads them like any other custom feedback. Each usage
// envelope is also offered to the cohorts listener as a serialised
// CVUsageEnvelope (`willGenerateCohortFeebacks`), posted to the work queue.
//
// Lifetime and threading: made per cohort flush; runs on the store's context
// queue (inside the scheduler's synchronous block). Holds the store, the file
// manager and the assembly's collaborators without owning them.
#pragma once

#include "assembly/configuration_bag.h"
#include "assembly/fbf_assembly_protocol.h"
#include "cohorts/cohort_dates.h"
#include "cohorts/random_source.h"
#include "cohorts/usage_store.h"
#include "corevireon.pb.h"

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace fbf {

class CohortFeedbackGeneratorProtocol {
 public:
  virtual ~CohortFeedbackGeneratorProtocol() = default;
  // Aggregates the period after the frequency's last aggregation and
  // advances `lastAggregations` to that period's end.
  virtual void aggregateNext(FlushFrequency frequency) = 0;
};

class CohortFeedbackGenerator final : public CohortFeedbackGeneratorProtocol {
 public:
  static constexpr int64_t kDefaultCohortsLookbackInDays = 56;
  static constexpr uint64_t kEngagementBucketSize = 50;

  // Writes one serialised cohort feedback record as a "Usage" file.
  using Persist = std::function<void(const std::string& bytes)>;
  // Hands one serialised CVUsageEnvelope to the cohorts listener.
  using Offer = std::function<void(const std::string& bytes)>;

  struct Collaborators {
    std::optional<ConfigurationBag> bag;
    // Null: envelopes carry an empty device context.
    const DeviceContextProtocol* deviceContext = nullptr;
    SystemTime today;
    CohortCalendar calendar = CohortCalendar::current();
    std::shared_ptr<RandomSource> random;
    Persist persist;
    // Null: nobody is listening.
    Offer offer;
  };

  // Production: the bag, device context, today, listener and file manager
  // of the assembly; files written with the flushing layer's persistence.
  CohortFeedbackGenerator(FBFAssemblyProtocol& assembly, DataStorageContainerProtocol& storageContainer,
                          std::shared_ptr<RandomSource> random = nullptr,
                          CohortCalendar calendar = CohortCalendar::current());
  CohortFeedbackGenerator(DataStorageContainerProtocol& storageContainer, Collaborators collaborators);

  void aggregateNext(FlushFrequency frequency) override;

  // The usage and propensity feedback over the lookback period ending with
  // the month of the monthly last aggregation.
  void generateUSLAndPropensityFeedback();
  // The month containing `date`, extended back to `cohortsLookbackInDays`
  // days before its end.
  std::optional<DateInterval> dateRangeForLookbackPeriod(SystemTime date) const;
  // One propensity envelope over the period.
  std::vector<corevireon::CVPropensityEnvelope> generatePropensityFeedback(SystemTime from, SystemTime to);
  // The usage envelope of one surface over a range (persisting and offering
  // it is the caller's).
  std::optional<corevireon::CVUsageEnvelope> usageEnvelope(corevireon::CVClient client, const DateInterval& range);

  // The period `aggregateNext` aggregates when the frequency's marker is at
  // `marker`: the capture range containing it while the marker is still the
  // collection start, afterwards `periodAfter(marker)` (no overlap, no gap).
  std::optional<DateInterval> pendingPeriod(FlushFrequency frequency, SystemTime marker) const;

  // The bag's "cohorts_lookback_in_days"; 56 without a bag or without the
  // key; a value below 1 is refused with a warning and 56 is used.
  int64_t cohortsLookbackInDays() const { return cohortsLookbackInDays(collaborators_.bag); }
  static int64_t cohortsLookbackInDays(const std::optional<ConfigurationBag>& bag);
  const CohortCalendar& calendar() const { return collaborators_.calendar; }

  // Counts below the bucket size unchanged, others rounded down to a
  // multiple of it. A bucket size of 0 is a programming error (it stops the
  // process).
  static uint64_t bucketEngagementCount(uint64_t count, uint64_t bucketSize);
  // The surfaces that get usage envelopes, in the order they are written.
  static const std::vector<corevireon::CVClient>& supportedCohortsClients();

 private:
  corevireon::CVDeviceContext deviceContextMessage() const;
  void persist(const corevireon::CVCohortsFeedback& feedback, bool offerToListener);
  void generateUsageFeedback(const DateInterval& range);
  bool propensity(SystemTime from, SystemTime to, std::string_view entityName, google::protobuf::Message& message);
  std::string formatShare(float share) const;

  DataStorageContainerProtocol& storageContainer_;
  Collaborators collaborators_;
  SystemTime collectionStart_;
  int64_t collectionStartTimestamp_;
  struct ShareFormatter;
  std::shared_ptr<ShareFormatter> numberFormatter_;
};

// Writes a cohort feedback record into CustomFeedback/Usage as
// "cohorts.<fresh UUID>.pb"; a failure is logged by the writer.
CohortFeedbackGenerator::Persist makeUsageFilePersister(FileManager& fileManager,
                                                         std::shared_ptr<RandomSource> random);

}  // namespace fbf
