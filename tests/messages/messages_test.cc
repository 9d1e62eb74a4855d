// Round trips of the session, cohort and IPC messages, and the schema
// properties the daemon relies on. Driven by the descriptors, so a field added
// later is covered without touching this file.
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
using google::protobuf::util::MessageDifferencer;

// Fills every field with distinct, non-default values (unsigned ones above
// 2^63, bytes with NULs, strings with non-ASCII), recursing into
// sub-messages; repeated fields and maps get two elements; of each real oneof
// only the first member is set.
class Filler {
 public:
  void Fill(Message* m, int depth = 0) {
    ASSERT_LT(depth, 12) << "unexpectedly deep nesting in " << m->GetTypeName();
    const Descriptor* d = m->GetDescriptor();
    const auto* r = m->GetReflection();
    for (int i = 0; i < d->field_count(); ++i) {
      const FieldDescriptor* f = d->field(i);
      if (f->real_containing_oneof() != nullptr && f->real_containing_oneof()->field(0) != f) continue;
      for (int n = 0; n < (f->is_repeated() ? 2 : 1); ++n) {
        const uint64_t v = ++counter_;
#define FBF_PUT(Kind, value) (f->is_repeated() ? r->Add##Kind(m, f, value) : r->Set##Kind(m, f, value))
        switch (f->cpp_type()) {
          case FieldDescriptor::CPPTYPE_INT32: FBF_PUT(Int32, -static_cast<int32_t>(v)); break;
          case FieldDescriptor::CPPTYPE_INT64: FBF_PUT(Int64, -static_cast<int64_t>(v) * 1000000007); break;
          case FieldDescriptor::CPPTYPE_UINT32: FBF_PUT(UInt32, 0xF0000000u + static_cast<uint32_t>(v)); break;
          case FieldDescriptor::CPPTYPE_UINT64: FBF_PUT(UInt64, 0x8000000000000000ull + v); break;
          case FieldDescriptor::CPPTYPE_DOUBLE: FBF_PUT(Double, 1.7e9 + v + 0.25); break;
          case FieldDescriptor::CPPTYPE_FLOAT: FBF_PUT(Float, v + 0.5f); break;
          case FieldDescriptor::CPPTYPE_BOOL: FBF_PUT(Bool, true); break;
          case FieldDescriptor::CPPTYPE_ENUM:
            FBF_PUT(EnumValue, f->enum_type()->value(f->enum_type()->value_count() - 1)->number());
            break;
          case FieldDescriptor::CPPTYPE_STRING:
            FBF_PUT(String, f->type() == FieldDescriptor::TYPE_BYTES
                                ? std::string("\x00\xff\x80", 3) + std::to_string(v)
                                : std::string(f->name()) + "-\u00e9-" + std::to_string(v));
            break;
          case FieldDescriptor::CPPTYPE_MESSAGE:
            Fill(f->is_repeated() ? r->AddMessage(m, f) : r->MutableMessage(m, f), depth + 1);
            break;
        }
#undef FBF_PUT
      }
    }
  }

 private:
  uint64_t counter_ = 0;
};

std::unique_ptr<Message> RoundTrip(const Message& in) {
  std::string bytes;
  EXPECT_TRUE(in.SerializeToString(&bytes));
  std::unique_ptr<Message> out(in.New());
  EXPECT_TRUE(out->ParseFromString(bytes));
  return out;
}

void ExpectSame(const Message& a, const Message& b) {
  std::string report;
  MessageDifferencer differ;
  differ.ReportDifferencesToString(&report);
  EXPECT_TRUE(differ.Compare(a, b)) << report;
}

// Guards against: a message kind (or one of its fields) that does not survive encoding.
TEST(RoundTrip, EveryOneofMemberAndEveryEnvelopeSurvivesEncoding) {
  struct Row {
    const Message* prototype;
    const char* oneof;  // nullptr: the whole message, filled
    int atLeast;
  };
  const Row rows[] = {
      {&corevireon::CVFeedbackPayload::default_instance(), "codable", 28},
      {&corevireon::CVCohortsFeedback::default_instance(), "whichKind", 4},
      {&fbf::ipc::Request::default_instance(), "operation", 7},
      {&fbf::ipc::DaemonMessage::default_instance(), "kind", 4},
      {&corevireon::CVClientSession::default_instance(), nullptr, 0},
      {&corevireon::CVUsageEnvelope::default_instance(), nullptr, 0},
      {&corevireon::CVPropensityEnvelope::default_instance(), nullptr, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.prototype->GetTypeName());
    if (row.oneof == nullptr) {
      std::unique_ptr<Message> m(row.prototype->New());
      Filler().Fill(m.get());
      ExpectSame(*m, *RoundTrip(*m));
      continue;
    }
    const auto* oneof = row.prototype->GetDescriptor()->FindOneofByName(row.oneof);
    ASSERT_NE(oneof, nullptr);
    ASSERT_GE(oneof->field_count(), row.atLeast);
    for (int i = 0; i < oneof->field_count(); ++i) {
      const FieldDescriptor* member = oneof->field(i);
      std::unique_ptr<Message> m(row.prototype->New());
      Filler().Fill(m->GetReflection()->MutableMessage(m.get(), member));
      const auto decoded = RoundTrip(*m);
      EXPECT_EQ(decoded->GetReflection()->GetOneofFieldDescriptor(*decoded, oneof), member) << member->name();
      ExpectSame(*m, *decoded);
    }
  }
}

// Guards against: JSON keys that differ from the declared field names, or a JSON form that loses data.
TEST(RoundTrip, JsonFormUsesTheDeclaredNamesAndRoundTrips) {
  corevireon::CVClientSession session;
  Filler().Fill(&session);
  std::string json;
  ASSERT_TRUE(google::protobuf::util::MessageToJsonString(session, &json).ok());
  EXPECT_NE(json.find("\"userGuidString\""), std::string::npos);
  corevireon::CVClientSession decoded;
  ASSERT_TRUE(google::protobuf::util::JsonStringToMessage(json, &decoded).ok());
  ExpectSame(session, decoded);

  for (const FileDescriptor* file : {session.GetDescriptor()->file(), fbf::ipc::Request::descriptor()->file()}) {
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

// Guards against: an empty string or message decoding as absent (or absent as empty) where readers tell them apart.
TEST(Presence, AbsentAndEmptyStayDistinct) {
  using namespace corevireon;
  const std::pair<const Descriptor*, std::vector<const char*>> rows[] = {
      {CVClientSession::descriptor(),
       {"feedbacks", "agent", "userGuidString", "countryCode", "locale", "usageSinceLookback", "cohortsFeedback"}},
      {CVSearchResultForFeedback::descriptor(),
       {"identifier", "jsonSectionBundleIdentifier", "userInput", "completedQuery", "intendedQuery", "punchout"}},
      {CVPunchout::descriptor(), {"urls"}},
      {CVSearchSuggestionForFeedback::descriptor(), {"identifier"}},
      {CVResultSection::descriptor(), {"results"}},
      {CVResultEngagementFeedback::descriptor(), {"titleText"}},
      {CVCBAEngagementFeedback::descriptor(), {"url"}},
      {CVStartLocalSearchFeedback::descriptor(), {"input"}},
      {CVStartNetworkSearchFeedback::descriptor(), {"input"}},
      {CVCustomFeedback::descriptor(), {"feedbackJSON"}},
      {fbf::ipc::Reply::descriptor(), {"error"}},
      {fbf::ipc::PendingFiles::descriptor(), {"oldestAgeSeconds"}},
  };
  for (const auto& [type, names] : rows) for (const char* name : names) {
    SCOPED_TRACE(type->name() + "." + name);
    const FieldDescriptor* f = type->FindFieldByName(name);
    ASSERT_NE(f, nullptr);
    ASSERT_TRUE(f->has_presence());
    const Message* prototype = google::protobuf::MessageFactory::generated_factory()->GetPrototype(type);
    std::unique_ptr<Message> empty(prototype->New());
    if (f->cpp_type() == FieldDescriptor::CPPTYPE_MESSAGE) {
      empty->GetReflection()->MutableMessage(empty.get(), f);
    } else if (f->cpp_type() == FieldDescriptor::CPPTYPE_STRING) {
      empty->GetReflection()->SetString(empty.get(), f, "");
    } else {
      empty->GetReflection()->SetInt64(empty.get(), f, 0);
    }
    auto presentAfterDecoding = [f](const Message& m) {
      const auto decoded = RoundTrip(m);
      return decoded->GetReflection()->HasField(*decoded, f);
    };
    EXPECT_TRUE(presentAfterDecoding(*empty));
    EXPECT_FALSE(presentAfterDecoding(*prototype));
  }
}

// Guards against: enum numbers unknown to this build being lost before they reach the upload.
TEST(Enums, UnknownNumbersPassThrough) {
  corevireon::CVClientSession session;
  session.set_previoussessionendreason(static_cast<corevireon::CVSessionEndReason>(42));
  auto* payload = session.mutable_feedbacks()->add_items();
  payload->set_type(-7);
  payload->mutable_resultengagement()->set_triggerevent(static_cast<corevireon::CVTriggerEngagementEvent>(1234));
  session.mutable_feedbacks()->add_items()->mutable_cbaengagement()->set_cbatype(
      static_cast<corevireon::CVCBAEngagementType>(-1));
  const auto decoded = RoundTrip(session);
  ExpectSame(session, *decoded);
  const auto& s = static_cast<const corevireon::CVClientSession&>(*decoded);
  EXPECT_EQ(static_cast<int>(s.previoussessionendreason()), 42);
  EXPECT_EQ(static_cast<int>(s.feedbacks().items(0).resultengagement().triggerevent()), 1234);
  EXPECT_EQ(static_cast<int>(s.feedbacks().items(1).cbaengagement().cbatype()), -1);
}

void DumpEnum(const EnumDescriptor* e, std::set<std::string>* out) {
  for (int i = 0; i < e->value_count(); ++i) {
    out->insert(e->full_name() + "." + e->value(i)->name() + " = " + std::to_string(e->value(i)->number()));
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
    out->insert(d->full_name() + "." + f->name() + " = " + std::to_string(f->number()) + " : " + label + type);
  }
  for (int i = 0; i < d->nested_type_count(); ++i) DumpMessage(d->nested_type(i), out);
  for (int i = 0; i < d->enum_type_count(); ++i) DumpEnum(d->enum_type(i), out);
}

// Guards against: a field or enum value changing its number, type or label (the on-disk and on-socket formats).
TEST(WireCompatibility, NoFieldOrEnumValueChangedItsNumber) {
  std::set<std::string> current;
  for (const FileDescriptor* file : {corevireon::CVClientSession::descriptor()->file(),
                                     fbf::ipc::Request::descriptor()->file()}) {
    for (int i = 0; i < file->message_type_count(); ++i) DumpMessage(file->message_type(i), &current);
    for (int i = 0; i < file->enum_type_count(); ++i) DumpEnum(file->enum_type(i), &current);
  }
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
                                     << "\n(fields may only be added; retire a number with `reserved`)";
  }
  EXPECT_GT(lines, 100);
}

}  // namespace
