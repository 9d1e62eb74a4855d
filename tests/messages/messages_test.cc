// The schema properties the daemon relies on: stable field numbers and
// presence where readers tell absent from empty.
//
// The wire-number check compares against wire_numbers.golden. After adding
// fields, regenerate it with FBF_UPDATE_WIRE_GOLDEN=1 and review the diff: it
// must only add lines.

#include <gtest/gtest.h>

#include <google/protobuf/descriptor.h>
#include <google/protobuf/descriptor.pb.h>

#include <fstream>

#include "corevireon.pb.h"
#include "fbf_ipc.pb.h"

namespace {

using google::protobuf::Descriptor;
using google::protobuf::EnumDescriptor;
using google::protobuf::FieldDescriptor;
using google::protobuf::FileDescriptor;

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
    // Presence keeps an empty value apart from an absent one, which readers tell apart.
    const char* label = f->is_repeated() && !f->is_map() ? "repeated "
                        : f->has_presence() && !f->message_type() ? "optional "
                                                                     : "";
    out->insert(d->full_name() + "." + f->name() + " = " + std::to_string(f->number()) + " : " + label + type);
  }
  for (int i = 0; i < d->nested_type_count(); ++i) DumpMessage(d->nested_type(i), out);
  for (int i = 0; i < d->enum_type_count(); ++i) DumpEnum(d->enum_type(i), out);
}

// Guards against: a field or enum value changing its number, type or label (the on-disk and on-socket formats),
// or a field losing the presence that keeps an empty value apart from an absent one.
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
