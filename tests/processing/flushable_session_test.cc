#include "flushing/flushable_session.h"
#include "flushing/session_payload.h"
#include "processing/processing_builders.h"

#include <gtest/gtest.h>

namespace fbf {
namespace {

using namespace fbf::testing;
using corevireon::CVClientSession;
using corevireon::CVFeedbackPayload;

constexpr uint64_t kMs = 1'000'000;  // nanoseconds per millisecond

CVClientSession sessionWith(std::initializer_list<CVFeedbackPayload> payloads) {
  CVClientSession s;
  s.mutable_feedbacks();
  for (const auto& p : payloads) *s.mutable_feedbacks()->add_items() = p;
  return s;
}

std::vector<uint64_t> clearInputTimestamps(const CVClientSession& s) {
  std::vector<uint64_t> out;
  for (const auto& p : s.feedbacks().items()) {
    if (p.has_clearinput()) out.push_back(p.clearinput().timestamp());
  }
  return out;
}

// Ordering and relative timestamps.
class SessionTimeline : public ::testing::Test {};

TEST_F(SessionTimeline, FeedbackIsSortedAndMadeRelativeInMilliseconds) {
  FlushableSession session(sessionWith({clearInput(5'000 * kMs + 999'999, 2), clearInput(1'000 * kMs, 1),
                                        clearInput(3'500 * kMs, 3)}));
  session.postProcessFeedback(nullptr);
  EXPECT_EQ(clearInputTimestamps(session.backingStore()), (std::vector<uint64_t>{0, 2'500, 4'000}));
  EXPECT_EQ(session.backingStore().feedbacks().items(0).queryid(), 1u);
}

TEST_F(SessionTimeline, EqualTimestampsKeepTheirStoredOrder) {
  FlushableSession session(sessionWith({clearInput(9 * kMs, 1), clearInput(4 * kMs, 2), clearInput(9 * kMs, 3),
                                        clearInput(4 * kMs, 4), clearInput(9 * kMs, 5)}));
  session.postProcessFeedback(nullptr);
  std::vector<uint64_t> queries;
  for (const auto& p : session.backingStore().feedbacks().items()) queries.push_back(p.queryid());
  EXPECT_EQ(queries, (std::vector<uint64_t>{2, 4, 1, 3, 5}));
}

TEST_F(SessionTimeline, PayloadWithoutMessageStaysInPlaceAndNothingCrossesIt) {
  auto sorted = FlushableSession(sessionWith({clearInput(30, 1), clearInput(20, 2), messageless(9),
                                              clearInput(10, 3), clearInput(5, 4)}))
                    .sessionFeedbacks();
  ASSERT_TRUE(sorted);
  std::vector<uint64_t> queries;
  for (const auto& p : *sorted) queries.push_back(p.queryid());
  EXPECT_EQ(queries, (std::vector<uint64_t>{2, 1, 0, 4, 3}));
}

// No device clock reading leaves as it stands: the base is the first time in
// processing order, and what lies before it (across a payload without a
// message, which nothing crosses when sorting) is removed.
TEST_F(SessionTimeline, DeviceTimesLeaveOnlyRelativeToTheFirstTime) {
  struct Row {
    const char* name;
    CVClientSession session;
    std::vector<uint64_t> expected;
    uint64_t removed;
  };
  const Row rows[] = {
      {"a first payload without message sets no base", sessionWith({messageless(9), clearInput(7'000 * kMs),
                                                                     clearInput(7'003 * kMs)}),
       {0, 3}, 0},
      {"a message without a time sets no base", sessionWith({clearInput(0), clearInput(9'000 * kMs),
                                                              clearInput(9'010 * kMs)}),
       {0, 0, 10}, 0},
      {"a time before the base is removed", sessionWith({clearInput(50'000 * kMs), messageless(9),
                                                          clearInput(20'000 * kMs), clearInput(60'000 * kMs)}),
       {0, 0, 10'000}, 1},
  };
  for (const auto& row : rows) {
    FlushableSession session(row.session);
    SessionRewriteSummary summary;
    session.postProcessFeedback(nullptr, &summary);
    EXPECT_EQ(clearInputTimestamps(session.backingStore()), row.expected) << row.name;
    EXPECT_EQ(summary.timestampsRemoved, row.removed) << row.name;
  }
}

TEST_F(SessionTimeline, NestedRankingTimesAreRelativeToo) {
  CVFeedbackPayload ranking;
  auto* section = ranking.mutable_ranking()->add_sections();
  ranking.mutable_ranking()->set_timestamp(2'000 * kMs);
  section->set_timestamp(2'005 * kMs);
  section->add_results()->set_timestamp(1'000 * kMs);  // before the base: removed
  FlushableSession session(sessionWith({clearInput(2'000 * kMs), ranking}));
  session.postProcessFeedback(nullptr);
  const auto& processed = session.backingStore().feedbacks().items(1).ranking();
  EXPECT_EQ(processed.timestamp(), 0u);
  EXPECT_EQ(processed.sections(0).timestamp(), 5u);
  EXPECT_EQ(processed.sections(0).results(0).timestamp(), 0u);
}

TEST_F(SessionTimeline, RemoveTimestampsClearsSessionStartButKeepsRelativeTimes) {
  auto s = sessionWith({clearInput(100 * kMs), clearInput(350 * kMs)});
  s.set_removetimestamps(true);
  s.set_sessionstart(1'700'000'000.5);
  FlushableSession session(s);
  session.postProcessFeedback(nullptr);
  EXPECT_EQ(session.backingStore().sessionstart(), 0.0);
  EXPECT_EQ(clearInputTimestamps(session.backingStore()), (std::vector<uint64_t>{0, 250}));
  EXPECT_EQ(session.generateSessionJSON()["base_time"], 0);
}

// Sessions without feedback.
class SessionWithoutFeedback : public ::testing::Test {};

TEST_F(SessionWithoutFeedback, AbsentListChangesNothingNotEvenSessionStart) {
  CVClientSession s;
  s.set_removetimestamps(true);
  s.set_sessionstart(1234.0);
  FlushableSession session(s);
  session.postProcessFeedback(nullptr);
  EXPECT_FALSE(session.backingStore().has_feedbacks());
  EXPECT_EQ(session.backingStore().sessionstart(), 1234.0);
  EXPECT_FALSE(session.sessionFeedbacks());
  EXPECT_TRUE(session.generateSessionJSON()["fb"].is_null());
}

TEST_F(SessionWithoutFeedback, EmptyListIsWrittenBackEmpty) {
  FlushableSession session(sessionWith({}));
  session.postProcessFeedback(nullptr);
  ASSERT_TRUE(session.backingStore().has_feedbacks());
  EXPECT_EQ(session.backingStore().feedbacks().items_size(), 0);
  EXPECT_EQ(session.generateSessionJSON()["fb"], nlohmann::ordered_json::array());
}

// The synthetic feedback put in front of the list.
class MissingItemsFeedback : public ::testing::Test {};

TEST_F(MissingItemsFeedback, MissingSuggestionsThenMissingResultsLeadTheList) {
  CVFeedbackPayload engaged;
  engaged.set_type(20);
  engaged.mutable_suggestionengagement()->set_timestamp(20 * kMs);
  *engaged.mutable_suggestionengagement()->mutable_suggestion() = suggestion("s-secret");
  FlushableSession session(sessionWith({visibleResults(1, {result("r-secret")}, 10 * kMs), engaged}));
  session.postProcessFeedback(nullptr);

  const auto& items = session.backingStore().feedbacks().items();
  ASSERT_EQ(items.size(), 4);
  ASSERT_TRUE(items[0].has_sessionmissingsuggestions());
  EXPECT_EQ(items[0].type(), 31);
  EXPECT_EQ(items[0].sessionmissingsuggestions().timestamp(), 0u);
  ASSERT_EQ(items[0].sessionmissingsuggestions().suggestions_size(), 1);
  EXPECT_EQ(items[0].sessionmissingsuggestions().suggestions(0).identifier(), "2");
  ASSERT_TRUE(items[1].has_sessionmissingresults());
  EXPECT_EQ(items[1].type(), 30);
  EXPECT_EQ(items[1].sessionmissingresults().results(0).identifier(), "1");
  EXPECT_TRUE(items[2].has_visibleresults());
  EXPECT_TRUE(items[3].has_suggestionengagement());
  EXPECT_EQ(session.backingStore().SerializeAsString().find("secret"), std::string::npos);
}

TEST_F(MissingItemsFeedback, NothingAddedWhenEverythingWasDelivered) {
  CVFeedbackPayload delivered;
  *delivered.mutable_resultsreceivedaftertimeout()->add_results() = result("r");
  FlushableSession session(sessionWith({visibleResults(1, {result("r")}), delivered}));
  session.postProcessFeedback(nullptr);
  EXPECT_EQ(session.backingStore().feedbacks().items_size(), 2);
}

// Usage counting sees the session before it is rewritten.
class RecordingSink final : public UsageEventSink {
 public:
  void reportUsageEvents(const CVClientSession& session) override { seen.push_back(session); }
  std::vector<CVClientSession> seen;
};

TEST(UsageCounting, SinkSeesTheSessionAsDecoded) {
  RecordingSink sink;
  FlushableSession session(sessionWith({clearInput(5 * kMs), clearInput(9 * kMs)}));
  session.postProcessFeedback(&sink);
  ASSERT_EQ(sink.seen.size(), 1u);
  EXPECT_EQ(clearInputTimestamps(sink.seen[0]), (std::vector<uint64_t>{5 * kMs, 9 * kMs}));

  CVClientSession noList;
  FlushableSession empty(noList);
  empty.postProcessFeedback(&sink);
  EXPECT_EQ(sink.seen.size(), 2u);
}

// The lazily built members.
class LazyMembers : public ::testing::Test {
 protected:
  static CVFeedbackPayload engagement(int trigger, const std::string& id) {
    CVFeedbackPayload p;
    auto* m = p.mutable_resultengagement();
    m->set_triggerevent(static_cast<corevireon::CVTriggerEngagementEvent>(trigger));
    *m->mutable_result() = result(id);
    return p;
  }
};

TEST_F(LazyMembers, EngagementsFollowTheSessionsClient) {
  auto s = sessionWith({engagement(8, "a"), engagement(1, "b"), messageless(10), clearInput(1)});
  CVFeedbackPayload site;
  site.mutable_didgotosite();
  *s.mutable_feedbacks()->add_items() = site;
  s.set_agent("Scoutlume/17");
  FlushableSession scoutlume(s);
  ASSERT_EQ(scoutlume.engagements().size(), 1u);
  EXPECT_EQ(scoutlume.engagements()[0].resultEngagement()->result().identifier(), "b");
  s.set_agent("Wayfin/17");
  EXPECT_EQ(FlushableSession(s).engagements().size(), 3u);
}

TEST_F(LazyMembers, ComputedOnFirstReadAndKeptUntilAssigned) {
  auto s = sessionWith({engagement(1, "a")});
  CVFeedbackPayload start;
  start.mutable_startlocalsearch()->set_input("p");
  *s.mutable_feedbacks()->add_items() = start;
  FlushableSession session(s);
  EXPECT_EQ(session.keystrokes().size(), 1u);
  EXPECT_EQ(session.resultsById().count("a"), 1u);
  session.postProcessFeedback(nullptr);
  // Read before processing: still the unprocessed identifiers.
  EXPECT_EQ(session.resultsById().count("a"), 1u);
  session.setResultsById({});
  EXPECT_TRUE(session.resultsById().empty());
  session.setKeystrokes({});
  EXPECT_TRUE(session.keystrokes().empty());
}

TEST_F(LazyMembers, ResultsByIdLaterResultWinsAndAnonymousSkipped) {
  auto first = result("x");
  first.set_title("first");
  auto second = result("x");
  second.set_title("second");
  corevireon::CVSearchResultForFeedback anonymous;
  FlushableSession session(sessionWith({visibleResults(1, {first, anonymous}), visibleResults(1, {second})}));
  ASSERT_EQ(session.resultsById().size(), 1u);
  EXPECT_EQ(session.resultsById().at("x").title(), "second");
}

// Fields written by a newer search daemon (here: numbers this build has no
// name for, at the session, payload, feedback and result level) never reach
// an upload, in either format; the protobuf form is the same bytes every
// time, whatever order the map was filled in.
TEST(SessionPayloads, CarryNoUnknownFieldAndAreReproducible) {
  auto s = sessionWith({visibleResults(1, {result("r")}, 5 * kMs)});
  (*s.mutable_resourceversions())["zeta"] = "1";
  (*s.mutable_resourceversions())["alpha"] = "2";
  (*s.mutable_resourceversions())["mid"] = "3";
  auto unknown = [](google::protobuf::Message& m, int number) {
    m.GetReflection()->MutableUnknownFields(&m)->AddLengthDelimited(number, "cnry-unknown-field");
  };
  auto* payload = s.mutable_feedbacks()->mutable_items(0);
  unknown(s, 900);
  unknown(*payload, 901);
  unknown(*payload->mutable_visibleresults(), 902);
  unknown(*payload->mutable_visibleresults()->mutable_results(0), 903);
  const std::string file = s.SerializeAsString();
  ASSERT_NE(file.find("cnry-unknown-field"), std::string::npos);

  for (auto format : {SessionPayloadFormat::protobuf, SessionPayloadFormat::json}) {
    SessionPayload first = makeSessionPayload(file, format, nullptr);
    ASSERT_EQ(first.outcome, SessionPayload::Outcome::ok);
    EXPECT_EQ(first.bytes.find("cnry-unknown-field"), std::string::npos);
    EXPECT_EQ(first.summary.unknownFieldsDiscarded, 4u);
    EXPECT_EQ(first.summary.identifiersMapped, 1u);
    EXPECT_EQ(makeSessionPayload(file, format, nullptr).bytes, first.bytes);
  }
  // The same session with its map filled the other way round.
  CVClientSession reordered;
  ASSERT_TRUE(reordered.ParseFromString(file));
  reordered.mutable_resourceversions()->clear();
  for (const char* key : {"mid", "alpha", "zeta"}) (*reordered.mutable_resourceversions())[key] = s.resourceversions().at(key);
  EXPECT_EQ(makeSessionPayload(reordered.SerializeAsString(), SessionPayloadFormat::protobuf, nullptr).bytes,
            makeSessionPayload(file, SessionPayloadFormat::protobuf, nullptr).bytes);

  EXPECT_EQ(makeSessionPayload("\xff\xff", SessionPayloadFormat::json, nullptr).outcome,
            SessionPayload::Outcome::undecodable);
  EXPECT_EQ(makeSessionPayload(sessionWith({}).SerializeAsString(), SessionPayloadFormat::json, nullptr).outcome,
            SessionPayload::Outcome::noFeedback);
}

}  // namespace
}  // namespace fbf
