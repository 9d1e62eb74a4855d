// Round trips of the session, cohort and IPC messages, and the properties of
// their schema that the rest of the daemon relies on: every feedback kind
// survives encoding, absent and empty stay distinguishable where readers care,
// out-of-range enum numbers pass through, and field numbers never change.
//
// The wire-number check compares against wire_numbers.golden. After adding
// fields, regenerate it with FBF_UPDATE_WIRE_GOLDEN=1 and review the diff: it
// must only add lines.

#include <gtest/gtest.h>

#include <google/protobuf/descriptor.h>
#include <google/protobuf/descriptor.pb.h>
#include <google/protobuf/message.h>
#include <google/protobuf/util/json_util.h>
#include <google/protobuf/util/message_differencer.h>

#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "corevireon.pb.h"
#include "fbf_ipc.pb.h"

namespace {

using google::protobuf::Descriptor;
using google::protobuf::EnumDescriptor;
using google::protobuf::FieldDescriptor;
using google::protobuf::FileDescriptor;
using google::protobuf::Message;
using google::protobuf::OneofDescriptor;
using google::protobuf::Reflection;
using google::protobuf::util::MessageDifferencer;

// Fills every field of a message with distinct, non-default values, recursing
// into sub-messages; repeated fields and maps get two elements; of each real
// oneof only the first member is set. Driven by the descriptors, so a field
// added later is covered without touching this test.
class Filler {
 public:
  void Fill(Message* message, int depth = 0) {
    ASSERT_LT(depth, 12) << "unexpectedly deep nesting in " << message->GetTypeName();
    const Descriptor* d = message->GetDescriptor();
    for (int i = 0; i < d->field_count(); ++i) {
      const FieldDescriptor* f = d->field(i);
      const OneofDescriptor* oneof = f->real_containing_oneof();
      if (oneof != nullptr && oneof->field(0) != f) continue;
      FillField(message, f, depth);
    }
  }

  void FillField(Message* message, const FieldDescriptor* f, int depth) {
    const int count = f->is_repeated() ? 2 : 1;
    for (int n = 0; n < count; ++n) SetOne(message, f, depth);
  }

 private:
  void SetOne(Message* m, const FieldDescriptor* f, int depth) {
    const Reflection* r = m->GetReflection();
    const bool rep = f->is_repeated();
    const uint64_t v = ++counter_;
    switch (f->cpp_type()) {
      case FieldDescriptor::CPPTYPE_INT32:
        rep ? r->AddInt32(m, f, -static_cast<int32_t>(v)) : r->SetInt32(m, f, -static_cast<int32_t>(v));
        break;
      case FieldDescriptor::CPPTYPE_INT64:
        rep ? r->AddInt64(m, f, -static_cast<int64_t>(v) * 1000000007)
            : r->SetInt64(m, f, -static_cast<int64_t>(v) * 1000000007);
        break;
      case FieldDescriptor::CPPTYPE_UINT32:
        rep ? r->AddUInt32(m, f, 0xF0000000u + static_cast<uint32_t>(v))
            : r->SetUInt32(m, f, 0xF0000000u + static_cast<uint32_t>(v));
        break;
      case FieldDescriptor::CPPTYPE_UINT64:
        // Above 2^63, so a signed field in the wrong place would show.
        rep ? r->AddUInt64(m, f, 0x8000000000000000ull + v)
            : r->SetUInt64(m, f, 0x8000000000000000ull + v);
        break;
      case FieldDescriptor::CPPTYPE_DOUBLE:
        rep ? r->AddDouble(m, f, 1.7e9 + v + 0.25) : r->SetDouble(m, f, 1.7e9 + v + 0.25);
        break;
      case FieldDescriptor::CPPTYPE_FLOAT:
        rep ? r->AddFloat(m, f, v + 0.5f) : r->SetFloat(m, f, v + 0.5f);
        break;
      case FieldDescriptor::CPPTYPE_BOOL:
        rep ? r->AddBool(m, f, true) : r->SetBool(m, f, true);
        break;
      case FieldDescriptor::CPPTYPE_ENUM: {
        // The last declared value: non-zero for every enum with two values.
        const EnumDescriptor* e = f->enum_type();
        const int number = e->value(e->value_count() - 1)->number();
        rep ? r->AddEnumValue(m, f, number) : r->SetEnumValue(m, f, number);
        break;
      }
      case FieldDescriptor::CPPTYPE_STRING: {
        std::string s = f->type() == FieldDescriptor::TYPE_BYTES
                            ? std::string("\x00\xff\x80", 3) + std::to_string(v)
                            : std::string(f->name()) + "-\u00e9-" + std::to_string(v);
        rep ? r->AddString(m, f, std::move(s)) : r->SetString(m, f, std::move(s));
        break;
      }
      case FieldDescriptor::CPPTYPE_MESSAGE: {
        Message* sub = rep ? r->AddMessage(m, f) : r->MutableMessage(m, f);
        Fill(sub, depth + 1);
        break;
      }
    }
  }

  uint64_t counter_ = 0;
};

template <typename T>
T RoundTrip(const T& in) {
  std::string bytes;
  EXPECT_TRUE(in.SerializeToString(&bytes));
  T out;
  EXPECT_TRUE(out.ParseFromString(bytes));
  return out;
}

std::string Diff(const Message& a, const Message& b) {
  std::string report;
  MessageDifferencer differ;
  differ.ReportDifferencesToString(&report);
  differ.Compare(a, b);
  return report;
}

const OneofDescriptor* CodableOneof() {
  const OneofDescriptor* o = corevireon::CVFeedbackPayload::descriptor()->FindOneofByName("codable");
  EXPECT_NE(o, nullptr);
  return o;
}

// A session with one payload per feedback kind, every field of every kind set.
corevireon::CVClientSession SessionWithEveryKind() {
  corevireon::CVClientSession session;
  Filler filler;
  filler.Fill(&session);
  session.clear_feedbacks();
  auto* list = session.mutable_feedbacks();
  const OneofDescriptor* codable = CodableOneof();
  for (int i = 0; i < codable->field_count(); ++i) {
    const FieldDescriptor* kind = codable->field(i);
    corevireon::CVFeedbackPayload* payload = list->add_items();
    payload->set_queryid(0xFFFFFFFF00000000ull + i);
    payload->set_type(i);
    filler.Fill(payload->GetReflection()->MutableMessage(payload, kind));
  }
  return session;
}

TEST(SessionRoundTrip, EveryFeedbackKindSurvivesEncoding) {
  const corevireon::CVClientSession session = SessionWithEveryKind();
  const OneofDescriptor* codable = CodableOneof();
  ASSERT_EQ(session.feedbacks().items_size(), codable->field_count());

  const corevireon::CVClientSession decoded = RoundTrip(session);
  EXPECT_TRUE(MessageDifferencer::Equals(session, decoded)) << Diff(session, decoded);

  std::set<int> seen;
  for (const auto& payload : decoded.feedbacks().items()) {
    const FieldDescriptor* kind = payload.GetReflection()->GetOneofFieldDescriptor(payload, codable);
    ASSERT_NE(kind, nullptr) << "payload of query " << payload.queryid() << " lost its feedback";
    EXPECT_EQ(static_cast<int>(payload.codable_case()), kind->number());
    seen.insert(kind->number());
    // Every field of the kind was filled, so an empty decoded message means
    // the kind does not round-trip.
    EXPECT_GT(payload.GetReflection()->GetMessage(payload, kind).ByteSizeLong(), 0u) << kind->name();
  }
  EXPECT_EQ(static_cast<int>(seen.size()), codable->field_count());
}

TEST(SessionRoundTrip, SessionFieldsSurviveEncoding) {
  corevireon::CVClientSession session;
  session.set_agent("Wayfin/17.0");
  session.set_userguidstring("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0");
  session.set_countrycode("FR");
  session.set_locale("fr_FR");
  (*session.mutable_resourceversions())["ranker"] = "41";
  (*session.mutable_resourceversions())["lexicon"] = "2024.06";
  session.set_removetimestamps(true);
  session.set_sessionstart(1718000000.75);
  session.set_previoussessionendreason(corevireon::CV_SESSION_END_REASON_SESSION_IDLE);
  session.set_duenabled(true);
  session.mutable_usagesincelookback()->set_activedaysincollectionperiod(17);
  session.mutable_cohortsfeedback()->mutable_wayfinusagepropensity()->set_gotosite("0.25");

  const corevireon::CVClientSession decoded = RoundTrip(session);
  EXPECT_TRUE(MessageDifferencer::Equals(session, decoded)) << Diff(session, decoded);
  EXPECT_EQ(decoded.sessionstart(), 1718000000.75);  // exact: a double, not a float
  EXPECT_EQ(decoded.resourceversions().at("lexicon"), "2024.06");
  EXPECT_EQ(decoded.cohortsfeedback().whichKind_case(), 3);
}

TEST(SessionRoundTrip, JsonFormRoundTripsWithTheFieldNamesAsWritten) {
  const corevireon::CVClientSession session = SessionWithEveryKind();
  std::string json;
  google::protobuf::util::JsonPrintOptions print;
  print.preserve_proto_field_names = false;
  ASSERT_TRUE(google::protobuf::util::MessageToJsonString(session, &json, print).ok());
  // The JSON keys are the field names exactly as declared.
  EXPECT_NE(json.find("\"userGuidString\""), std::string::npos);
  EXPECT_NE(json.find("\"matchesUnengagedSuggestion\""), std::string::npos);
  EXPECT_NE(json.find("\"feedbackJSON\""), std::string::npos);

  corevireon::CVClientSession decoded;
  ASSERT_TRUE(google::protobuf::util::JsonStringToMessage(json, &decoded).ok());
  EXPECT_TRUE(MessageDifferencer::Equals(session, decoded)) << Diff(session, decoded);
}

TEST(SessionSchema, EveryFeedbackKindHasAnUnsignedTimestampFirst) {
  const OneofDescriptor* codable = CodableOneof();
  ASSERT_GE(codable->field_count(), 28);
  for (int i = 0; i < codable->field_count(); ++i) {
    const FieldDescriptor* kind = codable->field(i);
    ASSERT_EQ(kind->cpp_type(), FieldDescriptor::CPPTYPE_MESSAGE) << kind->name();
    const FieldDescriptor* ts = kind->message_type()->FindFieldByNumber(1);
    ASSERT_NE(ts, nullptr) << kind->full_name();
    EXPECT_EQ(ts->name(), "timestamp") << kind->full_name();
    EXPECT_EQ(ts->type(), FieldDescriptor::TYPE_UINT64) << kind->full_name();
    EXPECT_FALSE(ts->is_repeated()) << kind->full_name();
  }
}

TEST(SessionSchema, FeedbackKindsCodedAgainstByName) {
  // The processing code names these kinds and fields; renaming one breaks it.
  struct Expect {
    const char* oneofMember;
    const char* message;
    std::vector<const char*> fields;
  };
  const std::vector<Expect> expected = {
      {"visibleResults", "CVVisibleResultsFeedback", {"results"}},
      {"visibleSuggestions", "CVVisibleSuggestionsFeedback", {"suggestions"}},
      {"suggestionEngagement", "CVSuggestionEngagementFeedback", {"suggestion"}},
      {"resultsReceivedAfterTimeout", "CVResultsReceivedAfterTimeoutFeedback", {"results"}},
      {"sectionRanking", "CVSectionRankingFeedback", {"results", "section"}},
      {"resultRanking", "CVResultRankingFeedback", {"result", "duplicateResults", "hiddenResults"}},
      {"ranking", "CVRankingFeedback", {"sections"}},
      {"resultEngagement",
       "CVResultEngagementFeedback",
       {"result", "titleText", "matchesUnengagedSuggestion", "triggerEvent", "destination"}},
      {"resultGrading", "CVResultGradingFeedback", {"result"}},
      {"lateSectionsAppended", "CVLateSectionsAppendedFeedback", {"sections"}},
      {"sectionEngagement", "CVSectionEngagementFeedback", {"section", "triggerEvent"}},
      {"cbaEngagement", "CVCBAEngagementFeedback", {"url", "cbaType"}},
      {"didGoToSite", "CVDidGoToSiteFeedback", {}},
      {"didGoToSearch", "CVDidGoToSearchFeedback", {}},
      {"startLocalSearch", "CVStartLocalSearchFeedback", {"input"}},
      {"startNetworkSearch", "CVStartNetworkSearchFeedback", {"input", "endpoint"}},
      {"sessionMissingResults", "CVSessionMissingResultsFeedback", {"results"}},
      {"sessionMissingSuggestions", "CVSessionMissingSuggestionsFeedback", {"suggestions"}},
      {"custom", "CVCustomFeedback", {"feedbackJSON"}},
  };
  const OneofDescriptor* codable = CodableOneof();
  for (const Expect& e : expected) {
    const FieldDescriptor* member =
        corevireon::CVFeedbackPayload::descriptor()->FindFieldByName(e.oneofMember);
    ASSERT_NE(member, nullptr) << e.oneofMember;
    EXPECT_EQ(member->containing_oneof(), codable) << e.oneofMember;
    ASSERT_EQ(member->message_type()->name(), e.message) << e.oneofMember;
    for (const char* field : e.fields) {
      EXPECT_NE(member->message_type()->FindFieldByName(field), nullptr) << e.message << "." << field;
    }
  }
}

// Sets `field` of a fresh `type` message to its "empty" value ("" or an empty
// message) and checks that presence survives encoding, then that an unset
// field stays absent.
void ExpectPresenceKept(const Descriptor* type, const char* fieldName) {
  SCOPED_TRACE(type->name() + "." + fieldName);
  const FieldDescriptor* f = type->FindFieldByName(fieldName);
  ASSERT_NE(f, nullptr);
  ASSERT_TRUE(f->has_presence());
  const Message* prototype = google::protobuf::MessageFactory::generated_factory()->GetPrototype(type);

  std::unique_ptr<Message> empty(prototype->New());
  if (f->cpp_type() == FieldDescriptor::CPPTYPE_MESSAGE) {
    empty->GetReflection()->MutableMessage(empty.get(), f);
  } else {
    ASSERT_EQ(f->cpp_type(), FieldDescriptor::CPPTYPE_STRING);
    empty->GetReflection()->SetString(empty.get(), f, "");
  }
  std::unique_ptr<Message> absent(prototype->New());

  std::string emptyBytes, absentBytes;
  ASSERT_TRUE(empty->SerializeToString(&emptyBytes));
  ASSERT_TRUE(absent->SerializeToString(&absentBytes));
  EXPECT_NE(emptyBytes, absentBytes);

  std::unique_ptr<Message> decoded(prototype->New());
  ASSERT_TRUE(decoded->ParseFromString(emptyBytes));
  EXPECT_TRUE(decoded->GetReflection()->HasField(*decoded, f));
  ASSERT_TRUE(decoded->ParseFromString(absentBytes));
  EXPECT_FALSE(decoded->GetReflection()->HasField(*decoded, f));
}

TEST(SessionAbsence, AbsentAndEmptyStayDistinct) {
  using namespace corevireon;
  ExpectPresenceKept(CVClientSession::descriptor(), "feedbacks");
  ExpectPresenceKept(CVClientSession::descriptor(), "agent");
  ExpectPresenceKept(CVClientSession::descriptor(), "userGuidString");
  ExpectPresenceKept(CVClientSession::descriptor(), "countryCode");
  ExpectPresenceKept(CVClientSession::descriptor(), "locale");
  ExpectPresenceKept(CVClientSession::descriptor(), "usageSinceLookback");
  ExpectPresenceKept(CVClientSession::descriptor(), "cohortsFeedback");
  ExpectPresenceKept(CVSearchResultForFeedback::descriptor(), "identifier");
  ExpectPresenceKept(CVSearchResultForFeedback::descriptor(), "jsonSectionBundleIdentifier");
  ExpectPresenceKept(CVSearchResultForFeedback::descriptor(), "userInput");
  ExpectPresenceKept(CVSearchResultForFeedback::descriptor(), "completedQuery");
  ExpectPresenceKept(CVSearchResultForFeedback::descriptor(), "intendedQuery");
  ExpectPresenceKept(CVSearchResultForFeedback::descriptor(), "punchout");
  ExpectPresenceKept(CVPunchout::descriptor(), "urls");
  ExpectPresenceKept(CVSearchSuggestionForFeedback::descriptor(), "identifier");
  ExpectPresenceKept(CVResultSection::descriptor(), "results");
  ExpectPresenceKept(CVResultEngagementFeedback::descriptor(), "titleText");
  ExpectPresenceKept(CVCBAEngagementFeedback::descriptor(), "url");
  ExpectPresenceKept(CVStartLocalSearchFeedback::descriptor(), "input");
  ExpectPresenceKept(CVStartNetworkSearchFeedback::descriptor(), "input");
  ExpectPresenceKept(CVCustomFeedback::descriptor(), "feedbackJSON");
}

TEST(SessionAbsence, ClearedSectionResultsStayAbsentInsideASession) {
  // The shape processing produces: a section engagement whose section lost
  // its results, next to one whose section legitimately has none.
  corevireon::CVClientSession session;
  auto* list = session.mutable_feedbacks();
  auto* cleared = list->add_items()->mutable_sectionengagement()->mutable_section();
  cleared->set_bundleidentifier("vireon.web_index");
  cleared->mutable_results()->add_items()->set_identifier("r1");
  cleared->clear_results();
  auto* emptySection = list->add_items()->mutable_sectionengagement()->mutable_section();
  emptySection->mutable_results();
  auto* result = list->add_items()->mutable_visibleresults()->add_results();
  result->set_identifier("");
  result->mutable_punchout()->mutable_urls();

  const corevireon::CVClientSession decoded = RoundTrip(session);
  ASSERT_EQ(decoded.feedbacks().items_size(), 3);
  const auto& a = decoded.feedbacks().items(0).sectionengagement().section();
  EXPECT_FALSE(a.has_results());
  EXPECT_EQ(a.bundleidentifier(), "vireon.web_index");
  const auto& b = decoded.feedbacks().items(1).sectionengagement().section();
  EXPECT_TRUE(b.has_results());
  EXPECT_EQ(b.results().items_size(), 0);
  const auto& r = decoded.feedbacks().items(2).visibleresults().results(0);
  EXPECT_TRUE(r.has_identifier());
  EXPECT_TRUE(r.identifier().empty());
  EXPECT_TRUE(r.punchout().has_urls());
  EXPECT_FALSE(r.has_title());
}

TEST(SessionAbsence, EmptyFeedbackListDiffersFromNone) {
  corevireon::CVClientSession none;
  none.set_agent("");
  corevireon::CVClientSession empty = none;
  empty.mutable_feedbacks();

  const auto decodedNone = RoundTrip(none);
  const auto decodedEmpty = RoundTrip(empty);
  EXPECT_FALSE(decodedNone.has_feedbacks());
  EXPECT_TRUE(decodedEmpty.has_feedbacks());
  EXPECT_EQ(decodedEmpty.feedbacks().items_size(), 0);
  // An empty agent is still an agent.
  EXPECT_TRUE(decodedNone.has_agent());
  EXPECT_FALSE(corevireon::CVClientSession().has_agent());
}

TEST(SessionEnums, UnknownNumbersPassThrough) {
  // vireond may be newer than this daemon; numbers it does not know must
  // reach the upload unchanged.
  corevireon::CVClientSession session;
  session.set_previoussessionendreason(static_cast<corevireon::CVSessionEndReason>(42));
  auto* payload = session.mutable_feedbacks()->add_items();
  payload->set_type(-7);
  auto* engagement = payload->mutable_resultengagement();
  engagement->set_triggerevent(static_cast<corevireon::CVTriggerEngagementEvent>(1234));
  auto* cba = session.mutable_feedbacks()->add_items()->mutable_cbaengagement();
  cba->set_cbatype(static_cast<corevireon::CVCBAEngagementType>(-1));

  const auto decoded = RoundTrip(session);
  EXPECT_EQ(static_cast<int>(decoded.previoussessionendreason()), 42);
  EXPECT_EQ(decoded.feedbacks().items(0).type(), -7);
  EXPECT_EQ(static_cast<int>(decoded.feedbacks().items(0).resultengagement().triggerevent()), 1234);
  EXPECT_EQ(static_cast<int>(decoded.feedbacks().items(1).cbaengagement().cbatype()), -1);
}

TEST(SessionEnums, NumbersTheCodeReliesOn) {
  using namespace corevireon;
  EXPECT_EQ(CV_KNOWN_FEEDBACK_TYPE_USAGE, 11);
  EXPECT_EQ(CV_KNOWN_FEEDBACK_TYPE_FEEDBACK_V2, 12);
  EXPECT_EQ(CV_KNOWN_FEEDBACK_TYPE_FEEDBACK_V2_PB, 13);
  EXPECT_EQ(CV_KNOWN_FEEDBACK_TYPE_LAST, 14);
  EXPECT_EQ(CVKnownFeedbackType_descriptor()->value_count(), 15);
  EXPECT_EQ(CV_FEEDBACK_DELETION_REASON_TOO_OLD, 1);
  EXPECT_EQ(CV_FEEDBACK_DELETION_REASON_UPLOADED, 12);
  EXPECT_EQ(CV_CLIENT_WEB_BROWSER, 1);
  EXPECT_EQ(CV_CLIENT_SYSTEM_SEARCH_UI, 2);
  EXPECT_EQ(CV_CLIENT_MESSAGING, 3);
  EXPECT_EQ(CV_CLIENT_NEWS, 4);
  EXPECT_EQ(CV_CBA_ENGAGEMENT_TYPE_SAME_ADDRESS, 3);
  EXPECT_EQ(CV_SESSION_END_REASON_LAST, 8);
  for (int n : {2, 3, 8, 9}) {
    EXPECT_NE(CVTriggerEngagementEvent_descriptor()->FindValueByNumber(n), nullptr) << n;
  }
}

TEST(CohortsFeedback, WhichKindIsTheMemberFieldNumber) {
  const Descriptor* d = corevireon::CVCohortsFeedback::descriptor();
  const OneofDescriptor* kind = d->FindOneofByName("whichKind");
  ASSERT_NE(kind, nullptr);
  std::set<int> propensityKinds;
  for (int i = 0; i < kind->field_count(); ++i) {
    const FieldDescriptor* member = kind->field(i);
    corevireon::CVCohortsFeedback feedback;
    Filler().Fill(feedback.GetReflection()->MutableMessage(&feedback, member));
    const auto decoded = RoundTrip(feedback);
    EXPECT_EQ(static_cast<int>(decoded.whichKind_case()), member->number()) << member->name();
    EXPECT_TRUE(MessageDifferencer::Equals(feedback, decoded)) << Diff(feedback, decoded);
    const std::string& type = member->message_type()->name();
    if (type.ends_with("UsagePropensity")) {
      propensityKinds.insert(member->number());
    }
  }
  // The JSON upload renders exactly kinds 2 to 5 as usage propensity.
  EXPECT_EQ(propensityKinds, (std::set<int>{2, 3, 4, 5}));
  EXPECT_EQ(corevireon::CVCohortsFeedback().whichKind_case(), 0);
}

TEST(CohortsFeedback, EnvelopesRoundTrip) {
  corevireon::CVUsageEnvelope usage;
  Filler().Fill(&usage);
  const auto decodedUsage = RoundTrip(usage);
  EXPECT_TRUE(MessageDifferencer::Equals(usage, decodedUsage)) << Diff(usage, decodedUsage);

  corevireon::CVPropensityEnvelope propensity;
  Filler().Fill(&propensity);
  const auto decodedPropensity = RoundTrip(propensity);
  EXPECT_TRUE(MessageDifferencer::Equals(propensity, decodedPropensity))
      << Diff(propensity, decodedPropensity);

  // Whole seconds since 1970 beyond 2038 must fit.
  usage.set_collectionendtimestamp(4102444800);
  EXPECT_EQ(RoundTrip(usage).collectionendtimestamp(), 4102444800);
}

TEST(Ipc, EveryRequestKindRoundTrips) {
  const OneofDescriptor* op = fbf::ipc::Request::descriptor()->FindOneofByName("operation");
  ASSERT_NE(op, nullptr);
  ASSERT_GE(op->field_count(), 7);
  std::set<uint64_t> ids;
  for (int i = 0; i < op->field_count(); ++i) {
    const FieldDescriptor* member = op->field(i);
    fbf::ipc::Request request;
    request.set_id(0xFFFFFFFFFFFFFF00ull + i);
    Filler().Fill(request.GetReflection()->MutableMessage(&request, member));
    const auto decoded = RoundTrip(request);
    EXPECT_EQ(static_cast<int>(decoded.operation_case()), member->number()) << member->name();
    EXPECT_EQ(decoded.id(), request.id());
    EXPECT_TRUE(MessageDifferencer::Equals(request, decoded)) << Diff(request, decoded);
    ids.insert(decoded.id());
  }
  EXPECT_EQ(static_cast<int>(ids.size()), op->field_count());
}

TEST(Ipc, RequestArgumentsKeepTheirFullRange) {
  fbf::ipc::Request request;
  request.set_id(7);
  request.mutable_updatewhitelists()->set_condition(UINT64_MAX);
  EXPECT_EQ(RoundTrip(request).updatewhitelists().condition(), UINT64_MAX);

  request.mutable_flushsessioneagerly()->set_path("/home/u/.cache/vireond/session.1.A.closed");
  auto decoded = RoundTrip(request);
  EXPECT_FALSE(decoded.has_updatewhitelists()) << "oneof keeps one operation";
  EXPECT_EQ(decoded.flushsessioneagerly().path(), "/home/u/.cache/vireond/session.1.A.closed");

  request.mutable_flushcustomfeedbacktype()->set_type("UserReport");
  EXPECT_EQ(RoundTrip(request).flushcustomfeedbacktype().type(), "UserReport");

  // An empty operation message is still an operation.
  request.mutable_flush();
  EXPECT_EQ(RoundTrip(request).operation_case(), fbf::ipc::Request::kFlush);
  request.clear_operation();
  EXPECT_EQ(RoundTrip(request).operation_case(), fbf::ipc::Request::OPERATION_NOT_SET);
}

TEST(Ipc, EveryDaemonMessageKindRoundTrips) {
  const OneofDescriptor* kind = fbf::ipc::DaemonMessage::descriptor()->FindOneofByName("kind");
  ASSERT_NE(kind, nullptr);
  ASSERT_GE(kind->field_count(), 4);
  for (int i = 0; i < kind->field_count(); ++i) {
    const FieldDescriptor* member = kind->field(i);
    fbf::ipc::DaemonMessage message;
    Filler().Fill(message.GetReflection()->MutableMessage(&message, member));
    const auto decoded = RoundTrip(message);
    EXPECT_EQ(static_cast<int>(decoded.kind_case()), member->number()) << member->name();
    EXPECT_TRUE(MessageDifferencer::Equals(message, decoded)) << Diff(message, decoded);
  }
}

TEST(Ipc, PayloadBytesAndReplyErrorsAreExact) {
  fbf::ipc::DaemonMessage upload;
  const std::string payload("\x78\x00\x9c\xff\x00\x01", 6);
  upload.mutable_willuploaddata()->set_data(payload);
  upload.mutable_willuploaddata()->set_format("FeedbackV2PB");
  const auto decodedUpload = RoundTrip(upload);
  EXPECT_EQ(decodedUpload.willuploaddata().data(), payload);
  EXPECT_EQ(decodedUpload.willuploaddata().format(), "FeedbackV2PB");

  fbf::ipc::DaemonMessage cohorts;
  corevireon::CVUsageEnvelope envelope;
  envelope.set_client(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI);
  envelope.mutable_usagesincelookback()->set_activedaysincollectionperiod(3);
  cohorts.mutable_willgeneratecohortfeebacks()->set_data(envelope.SerializeAsString());
  corevireon::CVUsageEnvelope carried;
  ASSERT_TRUE(carried.ParseFromString(RoundTrip(cohorts).willgeneratecohortfeebacks().data()));
  EXPECT_TRUE(MessageDifferencer::Equals(envelope, carried));

  fbf::ipc::DaemonMessage ok;
  ok.mutable_reply()->set_id(5);
  ok.mutable_reply()->set_ok(true);
  const auto decodedOk = RoundTrip(ok);
  EXPECT_TRUE(decodedOk.reply().ok());
  EXPECT_FALSE(decodedOk.reply().has_error());
  EXPECT_FALSE(decodedOk.reply().has_whitelistsignature());

  fbf::ipc::DaemonMessage failed;
  failed.mutable_reply()->set_id(6);
  failed.mutable_reply()->set_error("");
  const auto decodedFailed = RoundTrip(failed);
  EXPECT_FALSE(decodedFailed.reply().ok());
  EXPECT_TRUE(decodedFailed.reply().has_error());
  EXPECT_EQ(decodedFailed.reply().id(), 6u);
}

TEST(Ipc, StatusReplyKeepsAbsentAges) {
  fbf::ipc::DaemonMessage message;
  auto* status = message.mutable_statusreply();
  status->set_id(9);
  auto* closed = status->add_sessions();
  closed->set_name("closed");
  closed->set_files(3);
  closed->set_bytes(12345);
  closed->set_oldestageseconds(0);
  auto* none = status->add_sessions();
  none->set_name("processing");
  const auto decoded = RoundTrip(message);
  ASSERT_EQ(decoded.statusreply().sessions_size(), 2);
  EXPECT_TRUE(decoded.statusreply().sessions(0).has_oldestageseconds());
  EXPECT_FALSE(decoded.statusreply().sessions(1).has_oldestageseconds());
}

// ---------------------------------------------------------------------------
// Field numbers are part of the on-disk and on-socket formats.

void DumpEnum(const EnumDescriptor* e, std::set<std::string>* out) {
  for (int i = 0; i < e->value_count(); ++i) {
    out->insert(e->full_name() + "." + e->value(i)->name() + " = " +
                std::to_string(e->value(i)->number()));
  }
}

void DumpMessage(const Descriptor* d, std::set<std::string>* out) {
  if (d->options().map_entry()) return;
  for (int i = 0; i < d->field_count(); ++i) {
    const FieldDescriptor* f = d->field(i);
    std::string type = f->type_name();
    if (f->message_type() != nullptr) type = f->message_type()->full_name();
    if (f->enum_type() != nullptr) type = f->enum_type()->full_name();
    if (f->is_map()) {
      type = "map<" + std::string(f->message_type()->field(0)->type_name()) + "," +
             f->message_type()->field(1)->type_name() + ">";
    }
    const char* label = f->is_repeated() && !f->is_map() ? "repeated " : "";
    out->insert(d->full_name() + "." + f->name() + " = " + std::to_string(f->number()) + " : " +
                label + type);
  }
  for (int i = 0; i < d->nested_type_count(); ++i) DumpMessage(d->nested_type(i), out);
  for (int i = 0; i < d->enum_type_count(); ++i) DumpEnum(d->enum_type(i), out);
}

std::set<std::string> DumpFile(const FileDescriptor* file) {
  std::set<std::string> out;
  for (int i = 0; i < file->message_type_count(); ++i) DumpMessage(file->message_type(i), &out);
  for (int i = 0; i < file->enum_type_count(); ++i) DumpEnum(file->enum_type(i), &out);
  return out;
}

TEST(WireCompatibility, NoFieldOrEnumValueChangedItsNumber) {
  std::set<std::string> current = DumpFile(corevireon::CVClientSession::descriptor()->file());
  const std::set<std::string> ipc = DumpFile(fbf::ipc::Request::descriptor()->file());
  current.insert(ipc.begin(), ipc.end());

  const char* golden = FBF_WIRE_GOLDEN;
  if (const char* update = std::getenv("FBF_UPDATE_WIRE_GOLDEN"); update && *update) {
    std::ofstream out(golden, std::ios::trunc);
    for (const std::string& line : current) out << line << "\n";
    GTEST_SKIP() << "rewrote " << golden;
  }

  std::ifstream in(golden);
  ASSERT_TRUE(in) << "cannot read " << golden;
  std::string line;
  int lines = 0;
  while (std::getline(in, line)) {
    if (line.empty()) continue;
    ++lines;
    EXPECT_TRUE(current.count(line)) << "changed or removed: " << line
                                     << "\n(fields may only be added; retire a number with"
                                        " `reserved`)";
  }
  EXPECT_GT(lines, 100);
}

TEST(WireCompatibility, JsonNamesAreTheDeclaredNames) {
  // The JSON upload uses the declared names; a snake_case field would be
  // renamed there silently.
  for (const FileDescriptor* file : {corevireon::CVClientSession::descriptor()->file(),
                                     fbf::ipc::Request::descriptor()->file()}) {
    std::vector<const Descriptor*> pending;
    for (int i = 0; i < file->message_type_count(); ++i) pending.push_back(file->message_type(i));
    while (!pending.empty()) {
      const Descriptor* d = pending.back();
      pending.pop_back();
      for (int i = 0; i < d->nested_type_count(); ++i) pending.push_back(d->nested_type(i));
      if (d->options().map_entry()) continue;
      for (int i = 0; i < d->field_count(); ++i) {
        EXPECT_EQ(d->field(i)->json_name(), d->field(i)->name()) << d->field(i)->full_name();
      }
    }
  }
}

}  // namespace
