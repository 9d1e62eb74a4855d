#include "flushing/flushable_session.h"
#include "flushing/session_json.h"
#include "processing/processing_builders.h"

namespace fbf::testing {
namespace {

using corevireon::CVClientSession;
using corevireon::CVFeedbackPayload;

std::string jsonOf(const CVClientSession& s) { return FlushableSession(s).generateSessionJSON().dump(); }

// Guards against: a session key missing, misnamed, out of order, or with the wrong value or default.
TEST(SessionJSON, KeysInTheirOrderWithValuesOrDefaults) {
  EXPECT_EQ(jsonOf(CVClientSession()),
            R"({"fb":null,"agent":"","user_guid":"","country_code":"","locale":"","resource_versions":null,)"
            R"("base_time":0,"previous_session_end_reason":"unknown","du_enabled":false})");
  auto s = pb<CVClientSession>(R"(feedbacks { items { queryId: 1 type: 25 clearInput { timestamp: 5 } } }
      agent: "Wayfin/17" userGuidString: "GUID" countryCode: "GB" locale: "en_GB"
      resourceVersions { key: "ranker" value: "4.2" } resourceVersions { key: "entities" value: "9" }
      sessionStart: 1700000123.9 previousSessionEndReason: CV_SESSION_END_REASON_SESSION_IDLE duEnabled: true
      usageSinceLookback { activeDaysInCollectionPeriod: 12 } cohortsFeedback { wayfinUsagePropensity { goToSite: "0.25" } })");
  EXPECT_EQ(jsonOf(s), R"({"fb":[{"timestamp":5,"query_id":1,"type":"clear_input"}],"agent":"Wayfin/17",)"
                       R"("user_guid":"GUID","country_code":"GB","locale":"en_GB",)"
                       R"("resource_versions":{"entities":"9","ranker":"4.2"},"base_time":1700000123,)"
                       R"("previous_session_end_reason":"session_idle","du_enabled":true,)"
                       R"("usage_since_lookback":{"activeDaysInCollectionPeriod":12},)"
                       R"("usage_propensity":{"wayfinUsagePropensity":{"goToSite":"0.25"}}})");
  // Only the single-surface kinds are a usage propensity.
  s.mutable_cohortsfeedback()->mutable_newsusagepropensity();
  EXPECT_NE(jsonOf(s).find(R"("usage_propensity":{"newsUsagePropensity":{}})"), std::string::npos);
  s.mutable_cohortsfeedback()->mutable_usageenvelope();
  EXPECT_EQ(jsonOf(s).find("usage_propensity"), std::string::npos);
  // The base time is the whole seconds of the start, 0 outside the signed range.
  for (auto [start, base] : std::initializer_list<std::pair<double, int64_t>>{
           {-5.0, 0}, {9223372036854775808.0, 0}, {9223372036854774784.0, 9223372036854774784LL}}) {
    s.set_sessionstart(start);
    EXPECT_EQ(FlushableSession(s).generateSessionJSON()["base_time"].get<int64_t>(), base) << start;
  }
}

// Guards against: an event name off by one in the table, a deliberate duplicate lost, or unknown numbers named.
TEST(EventNames, TableWithItsDeliberateDuplicates) {
  const std::pair<int, const char*> events[] = {
      {3, "rank_sections"},   {4, "rank_sections"},   {10, "card_engagement"},         {11, "card_engagement"},
      {0, "unknown"},         {22, "visible_suggestions"}, {41, "client_timing"},      {42, "(unknown: 42)"},
      {50, "(unknown: 50)"},  {100, "custom_crowdsourcing"}, {102, "custom_scoutlume_result_features"},
      {103, "last_"},         {104, "(unknown: 104)"},  {-1, "(unknown: -1)"}};
  for (const auto& [number, name] : events) EXPECT_EQ(feedbackEventName(number), name) << number;
  const std::pair<int, const char*> reasons[] = {{7, "engagement_received"}, {8, "last_"}, {9, "(unknown: 9)"}};
  for (const auto& [number, name] : reasons) EXPECT_EQ(sessionEndReasonName(number), name) << number;
}

// Guards against: a feedback entry misrendered (defaults, 64-bit numbers, nesting) or uploaded when it has no body.
TEST(FeedbackDictionary, SetFieldsUnderTheirNamesWithExactNumbers) {
  // 2^53 + 1 is not representable as a double; a zero response size is a default and left out.
  EXPECT_EQ(feedbackDictionary(pb(R"(queryId: 18446744073709551615 type: 15 endNetworkSearch {
                timestamp: 9007199254740993 statusCode: 200 responseSize: 0 })"))->dump(),
            R"({"timestamp":9007199254740993,"statusCode":200,"query_id":18446744073709551615,"type":"network_search_end"})");
  EXPECT_EQ(feedbackDictionary(pb(R"(type: 4 ranking { sections { position: 2 section { results { items {
                identifier: "1" type: 3 score: 0.5 punchout { urls { } } } } } } })"))->dump(),
            R"({"sections":[{"section":{"results":{"items":[{"identifier":"1","type":3,)"
            R"("punchout":{"urls":{}},"score":0.5}]}},"position":2}],"query_id":0,"type":"rank_sections"})");
  EXPECT_EQ((*feedbackDictionary(pb("resultEngagement { triggerEvent: CV_TRIGGER_ENGAGEMENT_EVENT_PREVIEW_HOVER }")))["triggerEvent"], 8);

  CVFeedbackPayload custom;
  custom.set_type(100);
  custom.set_queryid(3);
  custom.mutable_custom()->set_timestamp(1);
  EXPECT_FALSE(feedbackDictionary(custom));
  for (const char* notAnObject : {"[1,2]", "{broken"}) {
    custom.mutable_custom()->set_feedbackjson(notAnObject);
    EXPECT_FALSE(feedbackDictionary(custom)) << notAnObject;
  }
  custom.mutable_custom()->set_feedbackjson(R"({"b":1,"a":{"x":[true]}})");
  EXPECT_EQ(feedbackDictionary(custom)->dump(),
            R"({"b":1,"a":{"x":[true]},"query_id":3,"type":"custom_crowdsourcing"})");

  CVClientSession s;
  *s.mutable_feedbacks()->add_items() = messageless(11);
  *s.mutable_feedbacks()->add_items() = clearInput(0, 1);
  s.mutable_feedbacks()->mutable_items(1)->set_type(11);
  EXPECT_EQ(FlushableSession(s).generateSessionJSON()["fb"].dump(), R"([{"query_id":1,"type":"card_engagement"}])");
}

// Guards against: bytes not in padded base64, or map entries in insertion order.
TEST(DictionaryForm, BytesAreBase64AndMapsAreSortedObjects) {
  corevireon::CVUsageEnvelope envelope;
  envelope.set_uuid(std::string("\x00\xff\x10\x20", 4));
  envelope.set_collectionstarttimestamp(-5);
  EXPECT_EQ(protobufDictionary(envelope).dump(), R"({"collectionStartTimestamp":-5,"uuid":"AP8QIA=="})");
  for (auto [in, out] : {std::pair{"", ""}, {"f", "Zg=="}, {"fo", "Zm8="}, {"foo", "Zm9v"}}) {
    EXPECT_EQ(base64Encode(in), out);
  }
  CVClientSession s;
  (*s.mutable_resourceversions())["zeta"] = "1";
  (*s.mutable_resourceversions())["alpha"] = "2";
  EXPECT_EQ(protobufDictionary(s).dump(), R"({"resourceVersions":{"alpha":"2","zeta":"1"}})");
}

}  // namespace
}  // namespace fbf::testing
