#include "flushing/session_payload.h"
#include "processing/processing_builders.h"

namespace fbf::testing {
namespace {

using corevireon::CVClientSession;
using corevireon::CVFeedbackPayload;

constexpr uint64_t kMs = 1'000'000;  // nanoseconds per millisecond

CVClientSession sessionWith(std::vector<CVFeedbackPayload> payloads) {
  CVClientSession s;
  s.mutable_feedbacks();
  for (const auto& p : payloads) *s.mutable_feedbacks()->add_items() = p;
  return s;
}

// "query:time" per payload, "-" for a payload without a message.
std::string timeline(const CVClientSession& s) {
  std::string out;
  for (const auto& p : s.feedbacks().items()) {
    out += (out.empty() ? "" : " ") + std::to_string(p.queryid()) + ":";
    if (p.codable_case() == CVFeedbackPayload::CODABLE_NOT_SET) {
      out += "-";
      continue;
    }
    const auto* r = p.GetReflection();
    const auto& m = r->GetMessage(p, r->GetOneofFieldDescriptor(p, p.GetDescriptor()->FindOneofByName("codable")));
    out += std::to_string(m.GetReflection()->GetUInt64(m, m.GetDescriptor()->FindFieldByNumber(1)));
  }
  return out;
}

// Guards against: feedback unsorted or unstably sorted, or a device clock reading leaving as it stands.
TEST(SessionTimeline, SortedStablyAndMadeRelativeToTheFirstTimeInMilliseconds) {
  struct Row {
    const char* name;
    std::vector<CVFeedbackPayload> payloads;
    std::string expected;
    uint64_t removed;
  };
  const Row rows[] = {
      {"sorted, relative, sub-millisecond dropped",
       {clearInput(5'000 * kMs + 999'999, 2), clearInput(1'000 * kMs, 1), clearInput(3'500 * kMs, 3)},
       "1:0 3:2500 2:4000", 0},
      {"equal times keep their stored order",
       {clearInput(9 * kMs, 1), clearInput(4 * kMs, 2), clearInput(9 * kMs, 3), clearInput(4 * kMs, 4),
        clearInput(9 * kMs, 5)},
       "2:0 4:0 1:5 3:5 5:5", 0},
      {"nothing crosses a payload without a message; earlier times removed",
       {clearInput(30 * kMs, 1), clearInput(20 * kMs, 2), messageless(9), clearInput(10 * kMs, 3),
        clearInput(5 * kMs, 4)},
       "2:0 1:10 0:- 4:0 3:0", 2},
      {"a first payload without a message sets no base",
       {messageless(9), clearInput(7'000 * kMs, 1), clearInput(7'003 * kMs, 2)}, "0:- 1:0 2:3", 0},
      {"a message without a time sets no base",
       {clearInput(0, 1), clearInput(9'000 * kMs, 2), clearInput(9'010 * kMs, 3)}, "1:0 2:0 3:10", 0},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    FlushableSession session(sessionWith(row.payloads));
    SessionRewriteSummary summary;
    session.postProcessFeedback(nullptr, &summary);
    EXPECT_EQ(timeline(session.backingStore()), row.expected);
    EXPECT_EQ(summary.timestampsRemoved, row.removed);
  }
}

// Guards against: nested ranking times, or the session start under removeTimestamps, leaving as device times.
TEST(SessionTimeline, NestedTimesAndSessionStart) {
  auto s = sessionWith({clearInput(2'000 * kMs), pb(R"(ranking { timestamp: 2000000000 sections {
      timestamp: 2005000000 results { timestamp: 1000000000 } } })")});  // the last one lies before the base
  s.set_removetimestamps(true);
  s.set_sessionstart(1'700'000'000.5);
  FlushableSession session(s);
  session.postProcessFeedback(nullptr);
  // Zero times are not printed.
  EXPECT_EQ(session.backingStore().feedbacks().items(1).ShortDebugString(),
            "ranking { sections { timestamp: 5 results { } } }");
  EXPECT_EQ(session.backingStore().sessionstart(), 0.0);
}

// Guards against: an absent feedback list invented, an empty one dropped, or the usage sink missing a session.
TEST(SessionWithoutFeedback, AbsentStaysAbsentEmptyStaysEmptyBothCounted) {
  struct RecordingSink final : UsageEventSink {
    void reportUsageEvents(const CVClientSession& session) override { seen.push_back(timeline(session)); }
    std::vector<std::string> seen;
  } sink;
  CVClientSession absent;
  absent.set_removetimestamps(true);
  absent.set_sessionstart(1234.0);
  FlushableSession none(absent), empty(sessionWith({})), some(sessionWith({clearInput(5 * kMs), clearInput(9 * kMs)}));
  for (auto* s : {&none, &empty, &some}) s->postProcessFeedback(&sink);
  EXPECT_EQ(none.backingStore().ShortDebugString(), "removeTimestamps: true sessionStart: 1234");
  EXPECT_FALSE(none.sessionFeedbacks());
  EXPECT_EQ(empty.backingStore().ShortDebugString(), "feedbacks { }");
  EXPECT_EQ(empty.generateSessionJSON()["fb"], nlohmann::ordered_json::array());
  EXPECT_EQ(sink.seen, (std::vector<std::string>{"", "", "0:5000000 0:9000000"}));
}

// Guards against: missing suggestions and results not leading the list, in that order, or carrying a secret.
TEST(MissingItemsFeedback, MissingSuggestionsThenMissingResultsLeadTheList) {
  FlushableSession session(sessionWith(
      {visibleResults(1, {result("r-secret")}, 10 * kMs),
       pb(R"(type: 20 suggestionEngagement { timestamp: 20000000 suggestion { identifier: "s-secret" type: 1 } })")}));
  session.postProcessFeedback(nullptr);
  EXPECT_EQ(session.backingStore().feedbacks().ShortDebugString(),
            R"(items { type: 31 sessionMissingSuggestions { suggestions { identifier: "2" type: 1 } } } )"
            R"(items { type: 30 sessionMissingResults { results { identifier: "1" type: 2 } } } )"
            R"(items { queryId: 1 type: 8 visibleResults { results { identifier: "1" type: 2 } } } )"
            R"(items { type: 20 suggestionEngagement { timestamp: 10 suggestion { identifier: "2" type: 1 } } })");
}

// Guards against: fields unknown to this build reaching an upload or going uncounted, or a file without feedback uploaded.
TEST(SessionPayloads, CarryNoUnknownFieldAndNeedFeedback) {
  auto s = sessionWith({visibleResults(1, {result("r")}, 5 * kMs)});
  auto* shown = s.mutable_feedbacks()->mutable_items(0)->mutable_visibleresults();
  int number = 900;  // at the session, payload, feedback and result level
  for (google::protobuf::Message* m : std::initializer_list<google::protobuf::Message*>{
           &s, s.mutable_feedbacks()->mutable_items(0), shown, shown->mutable_results(0)}) {
    m->GetReflection()->MutableUnknownFields(m)->AddLengthDelimited(number++, "cnry-unknown-field");
  }
  SessionPayload payload = makeSessionPayload(s.SerializeAsString(), SessionPayloadFormat::protobuf, nullptr);
  ASSERT_EQ(payload.outcome, SessionPayload::Outcome::ok);
  EXPECT_EQ(payload.bytes.find("cnry-unknown-field"), std::string::npos);
  EXPECT_EQ(payload.summary.unknownFieldsDiscarded, 4u);
  EXPECT_EQ(payload.summary.identifiersMapped, 1u);
  EXPECT_EQ(makeSessionPayload("\xff\xff", SessionPayloadFormat::json, nullptr).outcome,
            SessionPayload::Outcome::undecodable);
  EXPECT_EQ(makeSessionPayload(sessionWith({}).SerializeAsString(), SessionPayloadFormat::json, nullptr).outcome,
            SessionPayload::Outcome::noFeedback);
}

}  // namespace
}  // namespace fbf::testing
