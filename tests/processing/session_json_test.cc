#include "flushing/flushable_session.h"
#include "flushing/session_json.h"
#include "processing/processing_builders.h"

#include <gtest/gtest.h>

namespace fbf {
namespace {

using namespace fbf::testing;
using corevireon::CVClientSession;
using corevireon::CVFeedbackPayload;
using nlohmann::ordered_json;

std::vector<std::string> keysOf(const ordered_json& object) {
  std::vector<std::string> keys;
  for (const auto& item : object.items()) keys.push_back(item.key());
  return keys;
}

class SessionJSON : public ::testing::Test {
 protected:
  static CVClientSession fullSession() {
    CVClientSession s;
    *s.mutable_feedbacks()->add_items() = clearInput(5, 1);
    s.set_agent("Wayfin/17");
    s.set_userguidstring("GUID");
    s.set_countrycode("GB");
    s.set_locale("en_GB");
    (*s.mutable_resourceversions())["ranker"] = "4.2";
    (*s.mutable_resourceversions())["entities"] = "9";
    s.set_sessionstart(1'700'000'123.9);
    s.set_previoussessionendreason(corevireon::CV_SESSION_END_REASON_SESSION_IDLE);
    s.set_duenabled(true);
    s.mutable_usagesincelookback()->set_activedaysincollectionperiod(12);
    s.mutable_cohortsfeedback()->mutable_wayfinusagepropensity()->set_gotosite("0.25");
    return s;
  }
};

TEST_F(SessionJSON, KeysAndValuesInTheirOrder) {
  auto json = FlushableSession(fullSession()).generateSessionJSON();
  EXPECT_EQ(keysOf(json), (std::vector<std::string>{"fb", "agent", "user_guid", "country_code", "locale",
                                                    "resource_versions", "base_time", "previous_session_end_reason",
                                                    "du_enabled", "usage_since_lookback", "usage_propensity"}));
  EXPECT_EQ(json["agent"], "Wayfin/17");
  EXPECT_EQ(json["resource_versions"], ordered_json::parse(R"({"entities":"9","ranker":"4.2"})"));
  EXPECT_TRUE(json["base_time"].is_number_integer());
  EXPECT_EQ(json["base_time"], 1'700'000'123);
  EXPECT_EQ(json["previous_session_end_reason"], "session_idle");
  EXPECT_EQ(json["du_enabled"], true);
  EXPECT_EQ(json["usage_since_lookback"], ordered_json::parse(R"({"activeDaysInCollectionPeriod":12})"));
  EXPECT_EQ(json["usage_propensity"], ordered_json::parse(R"({"wayfinUsagePropensity":{"goToSite":"0.25"}})"));
}

TEST_F(SessionJSON, AbsentFieldsBecomeEmptyStringsNullOrNothing) {
  auto json = FlushableSession(CVClientSession()).generateSessionJSON();
  EXPECT_EQ(json.dump(),
            R"({"fb":null,"agent":"","user_guid":"","country_code":"","locale":"","resource_versions":null,)"
            R"("base_time":0,"previous_session_end_reason":"unknown","du_enabled":false})");
}

TEST_F(SessionJSON, UsagePropensityOnlyForSingleSurfaceKinds) {
  auto s = fullSession();
  s.mutable_cohortsfeedback()->mutable_usageenvelope();
  EXPECT_FALSE(FlushableSession(s).generateSessionJSON().contains("usage_propensity"));
  s.mutable_cohortsfeedback()->mutable_propensityenvelope();
  EXPECT_FALSE(FlushableSession(s).generateSessionJSON().contains("usage_propensity"));
  s.mutable_cohortsfeedback()->mutable_newsusagepropensity();
  EXPECT_EQ(FlushableSession(s).generateSessionJSON()["usage_propensity"],
            ordered_json::parse(R"({"newsUsagePropensity":{}})"));
  s.mutable_cohortsfeedback()->Clear();
  EXPECT_FALSE(FlushableSession(s).generateSessionJSON().contains("usage_propensity"));
}

TEST_F(SessionJSON, BaseTimeOutsideTheSignedRangeIsZero) {
  auto s = fullSession();
  s.set_sessionstart(-5.0);
  EXPECT_EQ(FlushableSession(s).generateSessionJSON()["base_time"], 0);
  s.set_sessionstart(9223372036854775808.0);
  EXPECT_EQ(FlushableSession(s).generateSessionJSON()["base_time"], 0);
  s.set_sessionstart(9223372036854774784.0);  // the largest double below 2^63
  EXPECT_EQ(FlushableSession(s).generateSessionJSON()["base_time"].get<int64_t>(), 9223372036854774784LL);
}

TEST(EventNames, TableWithItsDeliberateDuplicates) {
  EXPECT_EQ(feedbackEventName(3), "rank_sections");
  EXPECT_EQ(feedbackEventName(4), "rank_sections");
  EXPECT_EQ(feedbackEventName(10), "card_engagement");
  EXPECT_EQ(feedbackEventName(11), "card_engagement");
  EXPECT_EQ(feedbackEventName(0), "unknown");
  EXPECT_EQ(feedbackEventName(22), "visible_suggestions");
  EXPECT_EQ(feedbackEventName(41), "client_timing");
  EXPECT_EQ(feedbackEventName(42), "(unknown: 42)");
  EXPECT_EQ(feedbackEventName(50), "(unknown: 50)");
  EXPECT_EQ(feedbackEventName(100), "custom_crowdsourcing");
  EXPECT_EQ(feedbackEventName(102), "custom_scoutlume_result_features");
  EXPECT_EQ(feedbackEventName(103), "last_");
  EXPECT_EQ(feedbackEventName(104), "(unknown: 104)");
  EXPECT_EQ(feedbackEventName(-1), "(unknown: -1)");
  EXPECT_EQ(sessionEndReasonName(7), "engagement_received");
  EXPECT_EQ(sessionEndReasonName(8), "last_");
  EXPECT_EQ(sessionEndReasonName(9), "(unknown: 9)");
}

class FeedbackDictionary : public ::testing::Test {};

TEST_F(FeedbackDictionary, SetFieldsUnderProtoNamesWith64BitNumbersAsNumbers) {
  CVFeedbackPayload p;
  p.set_queryid(18'446'744'073'709'551'615ULL);
  p.set_type(15);
  auto* m = p.mutable_endnetworksearch();
  m->set_timestamp(9'007'199'254'740'993ULL);  // not representable as a double
  m->set_statuscode(200);
  m->set_responsesize(0);  // default: left out
  auto d = feedbackDictionary(p);
  ASSERT_TRUE(d);
  EXPECT_EQ(d->dump(),
            R"({"timestamp":9007199254740993,"statusCode":200,"query_id":18446744073709551615,)"
            R"("type":"network_search_end"})");
}

TEST_F(FeedbackDictionary, NestedMessagesRepeatedFieldsEnumsAndWrappers) {
  CVFeedbackPayload p;
  p.set_type(4);
  auto* sr = p.mutable_ranking()->add_sections();
  sr->set_position(2);
  auto* r = sr->mutable_section()->mutable_results()->add_items();
  r->set_identifier("1");
  r->set_type(3);
  r->set_score(0.5);
  r->mutable_punchout()->mutable_urls();  // present but empty
  auto d = feedbackDictionary(p);
  ASSERT_TRUE(d);
  EXPECT_EQ(d->dump(), R"({"sections":[{"section":{"results":{"items":[{"identifier":"1","type":3,)"
                       R"("punchout":{"urls":{}},"score":0.5}]}},"position":2}],"query_id":0,"type":"rank_sections"})");

  CVFeedbackPayload e;
  e.set_type(7);
  e.mutable_resultengagement()->set_triggerevent(corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_PREVIEW_HOVER);
  EXPECT_EQ((*feedbackDictionary(e))["triggerEvent"], 8);
}

TEST_F(FeedbackDictionary, CustomFeedbackUsesItsJSONObjectOrIsLeftOut) {
  CVFeedbackPayload p;
  p.set_type(100);
  p.set_queryid(3);
  auto* c = p.mutable_custom();
  c->set_timestamp(1);
  EXPECT_FALSE(feedbackDictionary(p));
  c->set_feedbackjson("[1,2]");
  EXPECT_FALSE(feedbackDictionary(p));
  c->set_feedbackjson("{broken");
  EXPECT_FALSE(feedbackDictionary(p));
  c->set_feedbackjson(R"({"b":1,"a":{"x":[true]}})");
  EXPECT_EQ(feedbackDictionary(p)->dump(), R"({"b":1,"a":{"x":[true]},"query_id":3,"type":"custom_crowdsourcing"})");
}

TEST_F(FeedbackDictionary, PayloadWithoutMessageIsLeftOutOfTheUpload) {
  CVClientSession s;
  *s.mutable_feedbacks()->add_items() = messageless(11);
  *s.mutable_feedbacks()->add_items() = clearInput(0, 1);
  s.mutable_feedbacks()->mutable_items(1)->set_type(11);
  auto fb = FlushableSession(s).generateSessionJSON()["fb"];
  ASSERT_EQ(fb.size(), 1u);
  EXPECT_EQ(fb[0].dump(), R"({"query_id":1,"type":"card_engagement"})");
}

TEST(DictionaryForm, BytesAreBase64AndMapsAreSortedObjects) {
  corevireon::CVUsageEnvelope envelope;
  envelope.set_uuid(std::string("\x00\xff\x10\x20", 4));
  envelope.set_collectionstarttimestamp(-5);
  EXPECT_EQ(protobufDictionary(envelope).dump(), R"({"collectionStartTimestamp":-5,"uuid":"AP8QIA=="})");
  EXPECT_EQ(base64Encode(""), "");
  EXPECT_EQ(base64Encode("f"), "Zg==");
  EXPECT_EQ(base64Encode("fo"), "Zm8=");
  EXPECT_EQ(base64Encode("foo"), "Zm9v");

  CVClientSession s;
  (*s.mutable_resourceversions())["zeta"] = "1";
  (*s.mutable_resourceversions())["alpha"] = "2";
  EXPECT_EQ(protobufDictionary(s).dump(), R"({"resourceVersions":{"alpha":"2","zeta":"1"}})");
}

}  // namespace
}  // namespace fbf
