// One search session from the moment its file has been decoded until its
// bytes are ready to upload.
//
// `postProcessFeedback` rewrites the session in place for upload, in this
// order: usage counting (through the optional sink), the removal of every
// field this build does not know (anywhere in the session, so a newer search
// daemon's additions never pass through unread), a stable sort of the
// feedback by timestamp, timestamps (nested feedback's too) made relative to
// the first feedback that has a time and converted from nanoseconds to whole
// milliseconds, or removed when they lie before it, identifier mapping and
// the privacy rewrites (SessionProcessingHelper), the engaged-visit filter
// (CBAFilterController), the synthetic missing-suggestions and
// missing-results feedback at the front, and the removal of the session's
// start time when the session asks for it. A session without a feedback list
// loses its unknown fields and is otherwise left unchanged.
//
// The result is uploaded either as `backingStore()` (protobuf) or as
// `generateSessionJSON()`. Owned by the flusher for the processing of one
// file, on the work queue; not thread-safe.
#pragma once

#include "corevireon.pb.h"
#include "flushing/reporters.h"

#include <nlohmann/json.hpp>

#include <google/protobuf/arena.h>

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace fbf {

// Where a session's usage is counted before it is rewritten (implemented by
// the usage store's side; flushing only sees this interface).
class UsageEventSink {
 public:
  virtual ~UsageEventSink() = default;
  virtual void reportUsageEvents(const corevireon::CVClientSession& session) = 0;
};

// What one `postProcessFeedback` changed, for people reviewing an upload
// (`fbfctl explain`).
struct SessionRewriteSummary {
  uint64_t identifiersMapped = 0;       // result and suggestion identifiers replaced
  uint64_t titlesCleared = 0;           // result titles and engagement titles removed
  uint64_t visitsReduced = 0;           // engaged-visit records kept as a match level only
  uint64_t visitsDropped = 0;           // engaged-visit records that matched nothing
  uint64_t unknownFieldsDiscarded = 0;  // fields this build does not know, anywhere in the session
  uint64_t timestampsRemoved = 0;       // device times that could not be made relative
};

class FlushableSession {
 public:
  // Keys of the session JSON.
  static constexpr std::string_view FeedbackKey = "fb";
  static constexpr std::string_view AgentKey = "agent";
  static constexpr std::string_view UserGuidKey = "user_guid";
  static constexpr std::string_view ResourceVersionsKey = "resource_versions";
  static constexpr std::string_view FirstUse = "first_use";  // defined, not written
  static constexpr std::string_view BaseTime = "base_time";
  static constexpr std::string_view RemoveTimestamps = "remove_timestamps";  // defined, not written
  static constexpr std::string_view PreviousEndReason = "previous_session_end_reason";
  static constexpr std::string_view CountryCode = "country_code";
  static constexpr std::string_view Locale = "locale";
  static constexpr std::string_view DiagnosticsAndUsageEnabled = "du_enabled";
  static constexpr std::string_view UsageSinceLookback = "usage_since_lookback";
  static constexpr std::string_view UsagePropensity = "usage_propensity";

  // An empty session.
  FlushableSession() : FlushableSession(corevireon::CVClientSession()) {}
  explicit FlushableSession(corevireon::CVClientSession backingStore);
  // A session decoded from a file's bytes into an arena of its own, so that
  // its thousands of small parts are allocated in a few blocks and freed at
  // once; none when the bytes are not a session.
  static std::optional<FlushableSession> decode(std::string_view bytes);

  corevireon::CVClientSession& backingStore() { return *backingStore_; }
  const corevireon::CVClientSession& backingStore() const { return *backingStore_; }
  // At least one feedback payload: sessions without one are never processed.
  bool hasFeedback() const { return backingStore_->has_feedbacks() && backingStore_->feedbacks().items_size() > 0; }

  // A copy of the feedback list in processing order, or none when the
  // session has no list. Ascending by the feedback message's timestamp,
  // stable; a payload without a feedback message stays where it is and
  // nothing moves across it.
  std::optional<std::vector<corevireon::CVFeedbackPayload>> sessionFeedbacks() const;

  // Lazily built from the feedback list in stored order at the first read,
  // then kept until assigned.
  // Engagement feedback that counts for the session's client.
  const std::vector<EngagementReporter>& engagements();
  void setEngagements(std::vector<EngagementReporter> engagements);
  // Search starts that carry a keystroke.
  const std::vector<KeystrokeReporter>& keystrokes();
  void setKeystrokes(std::vector<KeystrokeReporter> keystrokes);
  // Every result with an identifier in any feedback's contained results; a
  // later result with the same identifier wins.
  const std::map<std::string, corevireon::CVSearchResultForFeedback>& resultsById();
  void setResultsById(std::map<std::string, corevireon::CVSearchResultForFeedback> resultsById);

  // Rewrites the session for upload (see above). Call once. The sink, when
  // given, sees the session as it was decoded; the summary, when given, is
  // overwritten with what the rewrite changed.
  void postProcessFeedback(UsageEventSink* storageContainer, SessionRewriteSummary* summary = nullptr);

  // The JSON upload form, keys in this order: "fb", "agent", "user_guid",
  // "country_code", "locale", "resource_versions", "base_time",
  // "previous_session_end_reason", "du_enabled", then "usage_since_lookback"
  // and "usage_propensity" when they apply.
  nlohmann::ordered_json generateSessionJSON() const;

 private:
  FlushableSession(std::unique_ptr<google::protobuf::Arena> arena, corevireon::CVClientSession* backingStore)
      : arena_(std::move(arena)), backingStore_(backingStore) {}

  // Declared first so that it goes last: it owns backingStore_ when set.
  std::unique_ptr<google::protobuf::Arena> arena_;
  std::unique_ptr<corevireon::CVClientSession> owned_;
  corevireon::CVClientSession* backingStore_;
  std::optional<std::vector<EngagementReporter>> engagements_;
  std::optional<std::vector<KeystrokeReporter>> keystrokes_;
  std::optional<std::map<std::string, corevireon::CVSearchResultForFeedback>> resultsById_;
};

// The JSON dictionary of one feedback payload, or none when it carries no
// feedback message, or when its custom feedback text is absent or not a JSON
// object. It is the feedback message's dictionary form (session_json.h), or
// for custom feedback the object of its text, plus "query_id" (a number) and
// "type" (the event name).
std::optional<nlohmann::ordered_json> feedbackDictionary(const corevireon::CVFeedbackPayload& payload);

// The name of a payload's event number as the JSON upload writes it; 3 and 4
// share "rank_sections", 10 and 11 "card_engagement". Unknown numbers render
// as "(unknown: N)".
std::string feedbackEventName(int32_t type);

// The name of a session end reason; unknown numbers render as "(unknown: N)".
std::string sessionEndReasonName(int32_t reason);

}  // namespace fbf
