#include "flushing/flushable_session.h"

#include "flushing/cba_filter_controller.h"
#include "flushing/feedback_capabilities.h"
#include "flushing/session_json.h"
#include "flushing/session_processing_helper.h"

#include <algorithm>
#include <array>
#include <cmath>

namespace fbf {

using corevireon::CVFeedbackPayload;
using nlohmann::ordered_json;

namespace {

constexpr uint64_t kNanosecondsPerMillisecond = 1'000'000;

// Sorts a range of payload pointers for processing, ascending by the
// timestamp of the feedback message. A payload without a feedback message
// compares neither before nor after anything, so it is a fixed point: the runs
// between such payloads are sorted stably on their own.
template <class It>
void sortForProcessing(It begin, It end) {
  using Pointer = typename std::iterator_traits<It>::value_type;
  struct Keyed {
    uint64_t timestamp;
    Pointer payload;
  };
  std::vector<Keyed> keyed;
  keyed.reserve(static_cast<size_t>(std::distance(begin, end)));
  auto byTimestamp = [](const Keyed& a, const Keyed& b) { return a.timestamp < b.timestamp; };
  size_t runStart = 0;
  for (It it = begin; it != end; ++it) {
    if ((**it).codable_case() == CVFeedbackPayload::CODABLE_NOT_SET) {
      std::stable_sort(keyed.begin() + static_cast<std::ptrdiff_t>(runStart), keyed.end(), byTimestamp);
      runStart = keyed.size() + 1;
    }
    keyed.push_back({codableTimestamp(**it).value_or(0), *it});
  }
  std::stable_sort(keyed.begin() + static_cast<std::ptrdiff_t>(runStart), keyed.end(), byTimestamp);
  It out = begin;
  for (const Keyed& k : keyed) *out++ = k.payload;
}

// Moves the last element of the list to the front.
void moveLastToFront(google::protobuf::RepeatedPtrField<CVFeedbackPayload>* list) {
  std::rotate(list->pointer_begin(), std::prev(list->pointer_end()), list->pointer_end());
}

}  // namespace

FlushableSession::FlushableSession(corevireon::CVClientSession backingStore)
    : owned_(std::make_unique<corevireon::CVClientSession>(std::move(backingStore))), backingStore_(owned_.get()) {}

std::optional<FlushableSession> FlushableSession::decode(std::string_view bytes) {
  // Decoded, a session takes two to three times its encoded size: start with
  // blocks of about that, up to 256 KiB each. Whole pages: the arena keeps
  // its clean-up list at the end of a block, which must stay 8-byte aligned.
  constexpr size_t kPage = 4096;
  google::protobuf::ArenaOptions options;
  options.start_block_size = std::clamp<size_t>((bytes.size() * 2 + kPage - 1) / kPage * kPage, kPage, 256 * 1024);
  options.max_block_size = 256 * 1024;
  auto arena = std::make_unique<google::protobuf::Arena>(options);
  auto* session = google::protobuf::Arena::CreateMessage<corevireon::CVClientSession>(arena.get());
  if (!session->ParseFromArray(bytes.data(), static_cast<int>(bytes.size()))) return std::nullopt;
  return FlushableSession(std::move(arena), session);
}

std::optional<std::vector<CVFeedbackPayload>> FlushableSession::sessionFeedbacks() const {
  if (!backingStore_->has_feedbacks()) return std::nullopt;
  const auto& items = backingStore_->feedbacks().items();
  std::vector<const CVFeedbackPayload*> order;
  order.reserve(items.size());
  for (const auto& p : items) order.push_back(&p);
  sortForProcessing(order.begin(), order.end());
  std::vector<CVFeedbackPayload> out;
  out.reserve(order.size());
  for (const CVFeedbackPayload* p : order) out.push_back(*p);
  return out;
}

const std::vector<EngagementReporter>& FlushableSession::engagements() {
  if (!engagements_) {
    std::vector<EngagementReporter> list;
    const corevireon::CVClient client = cohortsClient(*backingStore_);
    if (backingStore_->has_feedbacks()) {
      for (const auto& payload : backingStore_->feedbacks().items()) {
        const google::protobuf::Message* message = codableMessage(payload);
        if (message == nullptr) continue;
        auto reporter = EngagementReporter::from(*message);
        if (reporter && reporter->isEngagement(client)) list.push_back(std::move(*reporter));
      }
    }
    engagements_ = std::move(list);
  }
  return *engagements_;
}

void FlushableSession::setEngagements(std::vector<EngagementReporter> engagements) {
  engagements_ = std::move(engagements);
}

const std::vector<KeystrokeReporter>& FlushableSession::keystrokes() {
  if (!keystrokes_) {
    std::vector<KeystrokeReporter> list;
    if (backingStore_->has_feedbacks()) {
      for (const auto& payload : backingStore_->feedbacks().items()) {
        const google::protobuf::Message* message = codableMessage(payload);
        if (message == nullptr) continue;
        auto reporter = KeystrokeReporter::from(*message);
        if (reporter && reporter->isKeystroke()) list.push_back(std::move(*reporter));
      }
    }
    keystrokes_ = std::move(list);
  }
  return *keystrokes_;
}

void FlushableSession::setKeystrokes(std::vector<KeystrokeReporter> keystrokes) { keystrokes_ = std::move(keystrokes); }

const std::map<std::string, corevireon::CVSearchResultForFeedback>& FlushableSession::resultsById() {
  if (!resultsById_) {
    std::map<std::string, corevireon::CVSearchResultForFeedback> map;
    if (backingStore_->has_feedbacks()) {
      for (const auto& payload : backingStore_->feedbacks().items()) {
        const google::protobuf::Message* message = codableMessage(payload);
        if (message == nullptr) continue;
        for (const auto* result : containedResults(*message)) {
          if (result->has_identifier()) map.insert_or_assign(result->identifier(), *result);
        }
      }
    }
    resultsById_ = std::move(map);
  }
  return *resultsById_;
}

void FlushableSession::setResultsById(std::map<std::string, corevireon::CVSearchResultForFeedback> resultsById) {
  resultsById_ = std::move(resultsById);
}

namespace {

// Clears the fields this build does not know (written by a newer search
// daemon) from `message` and everything inside it; returns how many there were.
uint64_t discardUnknownFields(google::protobuf::Message& message) {
  uint64_t discarded = 0;
  forEachMessage(message, [&discarded](google::protobuf::Message& m, const google::protobuf::Reflection& reflection,
                                       const MessageShape&) {
    if (const int n = reflection.GetUnknownFields(m).field_count(); n > 0) {
      discarded += static_cast<uint64_t>(n);
      reflection.MutableUnknownFields(&m)->Clear();
    }
  });
  return discarded;
}

// The first non-zero feedback timestamp in processing order, if any.
std::optional<uint64_t> baseTimeOf(const google::protobuf::RepeatedPtrField<CVFeedbackPayload>& list) {
  for (const auto& payload : list) {
    if (auto t = codableTimestamp(payload); t && *t != 0) return *t;
  }
  return std::nullopt;
}

size_t countVisits(const google::protobuf::RepeatedPtrField<CVFeedbackPayload>& list) {
  return static_cast<size_t>(
      std::count_if(list.begin(), list.end(), [](const CVFeedbackPayload& p) { return p.has_cbaengagement(); }));
}

}  // namespace

void FlushableSession::postProcessFeedback(UsageEventSink* storageContainer, SessionRewriteSummary* summary) {
  SessionRewriteSummary local;
  SessionRewriteSummary& done = summary ? *summary : local;
  done = SessionRewriteSummary();
  if (storageContainer != nullptr) storageContainer->reportUsageEvents(*backingStore_);
  // Before anything else: what this build cannot read it cannot rewrite.
  done.unknownFieldsDiscarded = discardUnknownFields(*backingStore_);
  if (!backingStore_->has_feedbacks()) return;

  auto* list = backingStore_->mutable_feedbacks()->mutable_items();
  sortForProcessing(list->pointer_begin(), list->pointer_end());

  // Device clock readings leave the device only as distances from the first
  // one: a payload without a message, or a message without a time (0), does
  // not set the base, and a time before the base is removed rather than
  // uploaded as it stands. Nested feedback (the rankings inside a ranking)
  // carries times of its own, treated alike.
  const std::optional<uint64_t> baseTime = baseTimeOf(*list);
  auto makeRelative = [&](google::protobuf::Message& m, const google::protobuf::Reflection& reflection,
                          const MessageShape& shape) {
    const auto* field = shape.timestamp;
    if (field == nullptr) return;
    const uint64_t t = reflection.GetUInt64(m, field);
    if (t == 0) return;
    if (baseTime && t >= *baseTime) {
      reflection.SetUInt64(&m, field, (t - *baseTime) / kNanosecondsPerMillisecond);
    } else {
      reflection.SetUInt64(&m, field, 0);
      ++done.timestampsRemoved;
    }
  };

  SessionProcessingHelper helper;
  for (auto& payload : *list) {
    google::protobuf::Message* message = mutableCodableMessage(payload);
    if (message == nullptr) continue;
    forEachMessage(*message, makeRelative);
    helper.process(message);
  }
  done.identifiersMapped = helper.identifiersMapped();
  done.titlesCleared = helper.titlesCleared();

  const size_t visitsBefore = countVisits(*list);
  CBAFilterController().filter(*list);
  done.visitsReduced = countVisits(*list);
  done.visitsDropped = visitsBefore - done.visitsReduced;

  // Moved, not copied: the helper's kept items become the uploaded ones.
  if (auto missing = helper.takeMissingResults(); !missing.empty()) {
    CVFeedbackPayload* payload = list->Add();
    payload->set_type(corevireon::CV_FEEDBACK_EVENT_TYPE_SESSION_MISSING_RESULTS);
    auto* feedback = payload->mutable_sessionmissingresults();
    feedback->set_timestamp(0);
    feedback->mutable_results()->Reserve(static_cast<int>(missing.size()));
    for (auto& r : missing) *feedback->add_results() = std::move(r);
    moveLastToFront(list);
  }
  if (auto missing = helper.takeMissingSuggestions(); !missing.empty()) {
    CVFeedbackPayload* payload = list->Add();
    payload->set_type(corevireon::CV_FEEDBACK_EVENT_TYPE_SESSION_MISSING_SUGGESTIONS);
    auto* feedback = payload->mutable_sessionmissingsuggestions();
    feedback->set_timestamp(0);
    feedback->mutable_suggestions()->Reserve(static_cast<int>(missing.size()));
    for (auto& s : missing) *feedback->add_suggestions() = std::move(s);
    moveLastToFront(list);
  }

  if (backingStore_->removetimestamps() && backingStore_->sessionstart() != 0) backingStore_->set_sessionstart(0);
}

std::string feedbackEventName(int32_t type) {
  static constexpr std::array<std::string_view, 42> kNames = {
      "unknown",
      "search_view_appear",
      "search_view_disappear",
      "rank_sections",
      "rank_sections",
      "result_ranking",
      "result",
      "result_engagement",
      "visible_results",
      "card_section",
      "card_engagement",
      "card_engagement",
      "search_start",
      "search_end",
      "network_search_start",
      "network_search_end",
      "local_search_start",
      "local_search_end",
      "error",
      "custom_unknown",
      "suggestion_engagement",
      "card_view_disappear",
      "visible_suggestions",
      "results_received_after_timeout",
      "late_sections_appended",
      "clear_input",
      "section_engagement",
      "visible_section_header",
      "did_go_to_site",
      "did_go_to_search",
      "session_missing_results",
      "session_missing_suggestions",
      "result_grade",
      "lookup_hint_graded",
      "connection_invalidated",
      "card_section_engagement",
      "session_end",
      "card_view_appear",
      "skip_vireon_search",
      "cache_hit",
      "cba_engagement",
      "client_timing",
  };
  if (type >= 0 && type < static_cast<int32_t>(kNames.size())) return std::string(kNames[type]);
  switch (type) {
    case 100: return "custom_crowdsourcing";
    case 101: return "custom_wayfin_autofill";
    case 102: return "custom_scoutlume_result_features";
    case 103: return "last_";
    default: return "(unknown: " + std::to_string(type) + ")";
  }
}

std::string sessionEndReasonName(int32_t reason) {
  static constexpr std::array<std::string_view, 9> kNames = {
      "unknown",      "no_previous_session", "external_request",    "session_idle", "max_session_time_passed",
      "guid_changed", "critical_memory",     "engagement_received", "last_",
  };
  if (reason >= 0 && reason < static_cast<int32_t>(kNames.size())) return std::string(kNames[reason]);
  return "(unknown: " + std::to_string(reason) + ")";
}

std::optional<ordered_json> feedbackDictionary(const CVFeedbackPayload& payload) {
  const google::protobuf::Message* message = codableMessage(payload);
  if (message == nullptr) return std::nullopt;
  ordered_json dictionary;
  if (payload.has_custom()) {
    if (!payload.custom().has_feedbackjson()) return std::nullopt;
    dictionary = ordered_json::parse(payload.custom().feedbackjson(), nullptr, /*allow_exceptions=*/false);
    if (!dictionary.is_object()) return std::nullopt;
  } else {
    dictionary = protobufDictionary(*message);
  }
  dictionary["query_id"] = payload.queryid();
  dictionary["type"] = feedbackEventName(payload.type());
  return dictionary;
}

ordered_json FlushableSession::generateSessionJSON() const {
  const auto& s = *backingStore_;
  ordered_json json = ordered_json::object();

  if (s.has_feedbacks()) {
    ordered_json fb = ordered_json::array();
    for (const auto& payload : s.feedbacks().items()) {
      if (auto dictionary = feedbackDictionary(payload)) fb.push_back(std::move(*dictionary));
    }
    json[FeedbackKey] = std::move(fb);
  } else {
    json[FeedbackKey] = nullptr;
  }
  json[AgentKey] = s.has_agent() ? s.agent() : std::string();
  json[UserGuidKey] = s.has_userguidstring() ? s.userguidstring() : std::string();
  json[CountryCode] = s.has_countrycode() ? s.countrycode() : std::string();
  json[Locale] = s.has_locale() ? s.locale() : std::string();
  if (s.resourceversions().empty()) {
    json[ResourceVersionsKey] = nullptr;
  } else {
    std::map<std::string, std::string> sorted(s.resourceversions().begin(), s.resourceversions().end());
    ordered_json versions = ordered_json::object();
    for (const auto& [name, version] : sorted) versions[name] = version;
    json[ResourceVersionsKey] = std::move(versions);
  }

  int64_t baseTime = 0;
  // 2^63: the first value a signed 64-bit integer cannot hold.
  constexpr double kInt64Limit = 9223372036854775808.0;
  if (!s.removetimestamps() && s.sessionstart() > 0 && s.sessionstart() < kInt64Limit) {
    baseTime = static_cast<int64_t>(std::trunc(s.sessionstart()));
  }
  json[BaseTime] = baseTime;
  json[PreviousEndReason] = sessionEndReasonName(s.previoussessionendreason());
  json[DiagnosticsAndUsageEnabled] = s.duenabled();
  if (s.has_usagesincelookback()) json[UsageSinceLookback] = protobufDictionary(s.usagesincelookback());
  if (s.has_cohortsfeedback()) {
    const int kind = s.cohortsfeedback().whichKind_case();
    if (kind >= 2 && kind <= 5) json[UsagePropensity] = protobufDictionary(s.cohortsfeedback());
  }
  return json;
}

}  // namespace fbf
