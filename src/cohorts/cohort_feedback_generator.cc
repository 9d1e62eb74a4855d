#include "cohorts/cohort_feedback_generator.h"

#include "flushing/cache_layout.h"
#include "platform/logging.h"
#include "util/lock.h"

#include <unicode/decimfmt.h>
#include <unicode/locid.h>
#include <unicode/numfmt.h>

#include <fmt/format.h>

#include <cmath>
#include <limits>
#include <set>
#include <tuple>

namespace fbf {
namespace {

constexpr int kUsageFeedbackTypeCode = 11;

spdlog::logger& generatorLog() { return logging::get("CohortFeedbackGenerator"); }

int64_t wholeSeconds(SystemTime t) { return static_cast<int64_t>(secondsSinceEpoch(t)); }

std::string uuidBytesAsString(const std::array<uint8_t, 16>& bytes) {
  return std::string(reinterpret_cast<const char*>(bytes.data()), bytes.size());
}

std::string uuidText(const std::array<uint8_t, 16>& b) {
  return fmt::format("{:02X}{:02X}{:02X}{:02X}-{:02X}{:02X}-{:02X}{:02X}-{:02X}{:02X}-{:02X}{:02X}{:02X}{:02X}{:02X}{:02X}",
                     b[0], b[1], b[2], b[3], b[4], b[5], b[6], b[7], b[8], b[9], b[10], b[11], b[12], b[13], b[14],
                     b[15]);
}

}  // namespace

// Shares as text: at most two fraction digits, "." as the separator
// whatever the user's locale.
struct CohortFeedbackGenerator::ShareFormatter {
  std::unique_ptr<icu::NumberFormat> format;

  ShareFormatter() {
    UErrorCode status = U_ZERO_ERROR;
    format.reset(icu::NumberFormat::createInstance(icu::Locale("en_US_POSIX"), status));
    if (U_FAILURE(status) || !format) FBF_FATAL("ICU has no number format for en_US_POSIX");
    format->setMaximumFractionDigits(2);
    format->setMinimumFractionDigits(0);
    format->setGroupingUsed(false);
    if (auto* decimal = dynamic_cast<icu::DecimalFormat*>(format.get())) decimal->setSignificantDigitsUsed(false);
  }
};

CohortFeedbackGenerator::Persist makeUsageFilePersister(FileManager& fileManager, std::shared_ptr<RandomSource> random) {
  if (!random) random = makeSystemRandomSource();
  return [&fileManager, random](const std::string& bytes) {
    persistCustomFeedback(fileManager, bytes, kUsageFeedbackTypeCode, "cohorts." + uuidText(random->uuidBytes()) + ".pb");
  };
}

CohortFeedbackGenerator::CohortFeedbackGenerator(FBFAssemblyProtocol& assembly,
                                                 DataStorageContainerProtocol& storageContainer,
                                                 std::shared_ptr<RandomSource> random, CohortCalendar calendar)
    : CohortFeedbackGenerator(storageContainer, [&] {
        Collaborators c;
        c.bag = assembly.cachedBag();
        c.deviceContext = &assembly.deviceContext();
        c.today = assembly.currentDate();
        c.calendar = std::move(calendar);
        c.random = random ? random : makeSystemRandomSource();
        c.persist = makeUsageFilePersister(assembly.fileManager(), c.random);
        // Delivered on the work queue, to whoever listens by then: the
        // listener slot and the client connection belong to that queue.
        c.offer = [&assembly](const std::string& bytes) {
          assembly.workloop().async([&assembly, bytes] {
            if (auto listener = assembly.cohortsListener()) listener->willGenerateCohortFeebacks(bytes);
          });
        };
        return c;
      }()) {}

CohortFeedbackGenerator::CohortFeedbackGenerator(DataStorageContainerProtocol& storageContainer,
                                                 Collaborators collaborators)
    : storageContainer_(storageContainer),
      collaborators_(std::move(collaborators)),
      collectionStart_(storageContainer.collectionStartDate()),
      collectionStartTimestamp_(wholeSeconds(collectionStart_)),
      numberFormatter_(std::make_shared<ShareFormatter>()) {
  if (!collaborators_.random) collaborators_.random = makeSystemRandomSource();
}

const std::vector<corevireon::CVClient>& CohortFeedbackGenerator::supportedCohortsClients() {
  static const std::vector<corevireon::CVClient> clients = {
      corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, corevireon::CV_CLIENT_WEB_BROWSER, corevireon::CV_CLIENT_NEWS,
      corevireon::CV_CLIENT_MESSAGING};
  return clients;
}

int64_t CohortFeedbackGenerator::cohortsLookbackInDays(const std::optional<ConfigurationBag>& bag) {
  if (bag) {
    if (auto days = bag->cohortsLookbackInDays()) {
      if (*days >= 1) return *days;
      generatorLog().warn("Ignoring cohorts_lookback_in_days {}: it must be at least 1; using {} days.", *days,
                          kDefaultCohortsLookbackInDays);
    }
  }
  return kDefaultCohortsLookbackInDays;
}

std::optional<DateInterval> CohortFeedbackGenerator::pendingPeriod(FlushFrequency frequency, SystemTime marker) const {
  // The first marker is the collection start: its whole period is the first
  // one. Every later marker is the end of an aggregated period, where the
  // next one starts even if the calendar has changed since.
  if (std::chrono::abs(marker - collectionStart_) < std::chrono::milliseconds(1)) {
    return collaborators_.calendar.containingCaptureRange(frequency, marker);
  }
  return collaborators_.calendar.periodAfter(frequency, marker);
}

uint64_t CohortFeedbackGenerator::bucketEngagementCount(uint64_t count, uint64_t bucketSize) {
  if (bucketSize == 0) FBF_FATAL("engagement bucket size of zero");
  if (count < bucketSize) return count;
  return count - count % bucketSize;
}

corevireon::CVDeviceContext CohortFeedbackGenerator::deviceContextMessage() const {
  corevireon::CVDeviceContext context;
  if (const auto* device = collaborators_.deviceContext) {
    if (auto v = device->localeIdentifier()) context.set_localeidentifier(*v);
    if (auto v = device->country()) context.set_country(*v);
    if (auto v = device->deviceModel()) context.set_devicemodel(*v);
    if (auto v = device->osVersion()) context.set_osversion(*v);
  }
  return context;
}

void CohortFeedbackGenerator::persist(const corevireon::CVCohortsFeedback& feedback, bool offerToListener) {
  std::string bytes = feedback.SerializeAsString();
  if (collaborators_.persist) collaborators_.persist(bytes);
  // The listener is sent the envelope itself, not the file's wrapper.
  if (offerToListener && collaborators_.offer && feedback.has_usageenvelope()) {
    collaborators_.offer(feedback.usageenvelope().SerializeAsString());
  }
}

void CohortFeedbackGenerator::aggregateNext(FlushFrequency frequency) {
  auto& context = storageContainer_.managedObjectContext();
  context.performAndWait([&] {
    auto& aggregations = storageContainer_.lastAggregations();
    auto it = aggregations.find(frequency);
    if (it == aggregations.end() || !it->second) return;
    auto last = it->second;
    auto timestamp = last->timestamp();
    if (!timestamp) return;
    auto range = pendingPeriod(frequency, *timestamp);
    if (!range) return;
    for (auto client : supportedCohortsClients()) {
      if (auto envelope = usageEnvelope(client, *range)) {
        corevireon::CVCohortsFeedback feedback;
        *feedback.mutable_usageenvelope() = std::move(*envelope);
        persist(feedback, true);
      }
    }
    if (frequency == FlushFrequency::monthly) generateUSLAndPropensityFeedback();
    last->setTimestamp(range->end);
    saveOrLogError(context);
  });
}

std::optional<corevireon::CVUsageEnvelope> CohortFeedbackGenerator::usageEnvelope(corevireon::CVClient client,
                                                                                 const DateInterval& range) {
  corevireon::CVUsageEnvelope envelope;
  storageContainer_.managedObjectContext().performAndWait([&] {
    envelope.set_client(client);
    envelope.set_collectionstarttimestamp(collectionStartTimestamp_);
    envelope.set_collectionendtimestamp(wholeSeconds(range.end));
    *envelope.mutable_context() = deviceContextMessage();
    auto days = collaborators_.calendar.wholeDays(range.start, range.end);
    if (!days) {
      generatorLog().error("Cohorts generator couldn't determine the lookback period.");
      days = 0;
    }
    envelope.set_configuredlookbacktimeindays(static_cast<int32_t>(*days));
    std::set<std::tuple<int32_t, int32_t, int32_t>> activeDays;
    for (const auto& sentinel : storageContainer_.queryProcessor().sessionSentinels(client, range)) {
      auto timestamp = sentinel->timestamp();
      if (!timestamp) continue;
      if (auto day = collaborators_.calendar.dayOf(*timestamp)) activeDays.insert(*day);
    }
    envelope.mutable_usagesincelookback()->set_activedaysincollectionperiod(static_cast<uint32_t>(activeDays.size()));
    envelope.set_uuid(uuidBytesAsString(collaborators_.random->uuidBytes()));
  });
  return envelope;
}

std::optional<DateInterval> CohortFeedbackGenerator::dateRangeForLookbackPeriod(SystemTime date) const {
  auto month = collaborators_.calendar.containingMonth(date);
  if (!month) return std::nullopt;
  auto start = collaborators_.calendar.addingDays(month->end, -cohortsLookbackInDays());
  if (!start) return std::nullopt;
  return DateInterval{*start, month->end};
}

void CohortFeedbackGenerator::generateUsageFeedback(const DateInterval& range) {
  for (auto client : supportedCohortsClients()) {
    if (auto envelope = usageEnvelope(client, range)) {
      corevireon::CVCohortsFeedback feedback;
      *feedback.mutable_usageenvelope() = std::move(*envelope);
      persist(feedback, true);
    }
  }
}

void CohortFeedbackGenerator::generateUSLAndPropensityFeedback() {
  auto& aggregations = storageContainer_.lastAggregations();
  auto it = aggregations.find(FlushFrequency::monthly);
  if (it == aggregations.end() || !it->second) return;
  auto timestamp = it->second->timestamp();
  if (!timestamp) return;
  auto period = dateRangeForLookbackPeriod(*timestamp);
  if (!period) return;
  generateUsageFeedback(*period);
  for (auto& envelope : generatePropensityFeedback(period->start, period->end)) {
    corevireon::CVCohortsFeedback feedback;
    *feedback.mutable_propensityenvelope() = std::move(envelope);
    persist(feedback, false);
  }
}

std::vector<corevireon::CVPropensityEnvelope> CohortFeedbackGenerator::generatePropensityFeedback(SystemTime from,
                                                                                                 SystemTime to) {
  corevireon::CVPropensityEnvelope envelope;
  storageContainer_.managedObjectContext().performAndWait([&] {
    *envelope.mutable_context() = deviceContextMessage();
    envelope.set_collectionstarttimestamp(collectionStartTimestamp_);
    envelope.set_collectionendtimestamp(wholeSeconds(to));
    auto days = collaborators_.calendar.wholeDays(from, to);
    if (!days) {
      generatorLog().error("Cohorts generator couldn't determine the lookback period.");
      days = 0;
    }
    envelope.set_configuredlookbacktimeindays(static_cast<int32_t>(*days));
    if (!propensity(from, to, VIRScoutlumeSession::kEntityName, *envelope.mutable_scoutlumeusagepropensity())) {
      envelope.clear_scoutlumeusagepropensity();
    }
    if (!propensity(from, to, VIRWayfinSession::kEntityName, *envelope.mutable_wayfinusagepropensity())) {
      envelope.clear_wayfinusagepropensity();
    }
    // News engagement is not collected; its message is always sent empty.
    envelope.mutable_newsusagepropensity();
    if (!propensity(from, to, VIRImagesSession::kEntityName, *envelope.mutable_imagesusagepropensity())) {
      envelope.clear_imagesusagepropensity();
    }
    envelope.set_uuid(uuidBytesAsString(collaborators_.random->uuidBytes()));
  });
  return {envelope};
}

bool CohortFeedbackGenerator::propensity(SystemTime from, SystemTime to, std::string_view entityName,
                                         google::protobuf::Message& message) {
  generatorLog().debug("Generating usage propensity");
  auto sums = storageContainer_.queryProcessor().fetchColumnSums(entityName, from, to);
  float total = 0;
  for (const auto& [column, sum] : sums) total += static_cast<float>(sum);
  if (!(total > 0)) return false;
  const auto* descriptor = message.GetDescriptor();
  const auto* reflection = message.GetReflection();
  for (const auto& [column, sum] : sums) {
    const auto* field = descriptor->FindFieldByName(column);
    if (!field || field->cpp_type() != google::protobuf::FieldDescriptor::CPPTYPE_STRING) continue;
    reflection->SetString(&message, field, formatShare(static_cast<float>(sum) / total));
  }
  // Only a damaged store holds counts this large: skip the report rather than
  // convert out of range or stop the daemon over it.
  constexpr auto kMaximum = static_cast<uint64_t>(std::numeric_limits<int32_t>::max());
  const uint64_t bucketed = total < 4.0e9f ? bucketEngagementCount(static_cast<uint64_t>(total), kEngagementBucketSize)
                                           : kMaximum + 1;
  if (bucketed > kMaximum) {
    generatorLog().error("Total engagements of {} do not fit a 32-bit integer; no usage propensity", entityName);
    return false;
  }
  if (const auto* field = descriptor->FindFieldByName("totalEngagements")) {
    reflection->SetInt32(&message, field, static_cast<int32_t>(bucketed));
  }
  return true;
}

std::string CohortFeedbackGenerator::formatShare(float share) const {
  icu::UnicodeString text;
  numberFormatter_->format->format(static_cast<double>(share), text);
  std::string out;
  text.toUTF8String(out);
  return out;
}

}  // namespace fbf
