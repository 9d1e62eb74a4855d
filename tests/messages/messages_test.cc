// The schema properties the daemon relies on: presence where readers tell
// absent from empty, and stable field numbers.
//
// The wire-number check compares against wire_numbers.golden. After adding
// fields, regenerate it with FBF_UPDATE_WIRE_GOLDEN=1 and review the diff: it
// must only add lines.

#include <gtest/gtest.h>

#include <google/protobuf/descriptor.h>
#include <google/protobuf/descriptor.pb.h>

#include <cstdlib>
#include <fstream>
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
  // Presence is what keeps an empty value apart from an absent one on the wire.
  for (const auto& [type, names] : rows) {
    for (const char* name : names) {
      const FieldDescriptor* f = type->FindFieldByName(name);
      ASSERT_NE(f, nullptr) << type->name() << "." << name;
      EXPECT_TRUE(f->has_presence()) << type->name() << "." << name;
    }
  }
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
