// A session file as the search daemon leaves it in the shared cache: any
// bytes through decoding, the whole privacy rewrite and both upload forms.
// After the rewrite no result or suggestion keeps an identifier that is not
// a small session-local number, and both forms read back.
#include "corevireon.pb.h"
#include "flushing/flushable_session.h"
#include "fuzz_check.h"
#include "platform/logging.h"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>
#include <google/protobuf/stubs/logging.h>

#include <cstdint>
#include <sstream>
#include <string>
#include <vector>

namespace {

using google::protobuf::FieldDescriptor;
using google::protobuf::Message;

bool carriesIdentifier(const Message& m) {
  const auto* d = m.GetDescriptor();
  return d == corevireon::CVSearchResultForFeedback::descriptor() ||
         d == corevireon::CVSearchSuggestionForFeedback::descriptor();
}

// Calls `visit` for every message in the tree, the root included.
template <typename Visit>
void walk(const Message& m, const Visit& visit) {
  visit(m);
  const auto* r = m.GetReflection();
  std::vector<const FieldDescriptor*> fields;
  r->ListFields(m, &fields);
  for (const auto* f : fields) {
    if (f->cpp_type() != FieldDescriptor::CPPTYPE_MESSAGE) continue;
    if (f->is_repeated()) {
      for (int i = 0; i < r->FieldSize(m, f); ++i) walk(r->GetRepeatedMessage(m, f, i), visit);
    } else {
      walk(r->GetMessage(m, f), visit);
    }
  }
}

const std::string* identifierOf(const Message& m) {
  const auto* f = m.GetDescriptor()->FindFieldByName("identifier");
  if (!m.GetReflection()->HasField(m, f)) return nullptr;
  static thread_local std::string scratch;
  scratch = m.GetReflection()->GetString(m, f);
  return &scratch;
}

// "1", "2", ... up to `limit`.
bool isSmallNumber(const std::string& s, size_t limit) {
  if (s.empty() || s.size() > 19 || s[0] == '0') return false;
  for (char c : s) {
    if (c < '0' || c > '9') return false;
  }
  return std::stoull(s) <= limit;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  google::protobuf::SetLogHandler(nullptr);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  // Decoded as the flusher decodes it, into an arena of its own.
  auto decoded = fbf::FlushableSession::decode(std::string_view(reinterpret_cast<const char*>(data), size));
  if (!decoded) return 0;
  fbf::FlushableSession& flushable = *decoded;
  const corevireon::CVClientSession& session = flushable.backingStore();
  // The flusher drops sessions without feedback before processing them.
  if (!session.has_feedbacks() || session.feedbacks().items_size() == 0) return 0;

  // Each distinct identifier gets at most one number, so there are never
  // more numbers than identified items.
  size_t identified = 0;
  walk(session, [&](const Message& m) {
    if (carriesIdentifier(m) && identifierOf(m) && !identifierOf(m)->empty()) ++identified;
  });

  flushable.postProcessFeedback(nullptr);

  walk(flushable.backingStore(), [&](const Message& m) {
    if (!carriesIdentifier(m)) return;
    const std::string* id = identifierOf(m);
    if (!id) return;
    FUZZ_CHECK(isSmallNumber(*id, identified), "identifier \"%s\" left in a %s after the rewrite (%zu identified)",
               id->c_str(), m.GetDescriptor()->name().c_str(), identified);
  });

  // Protobuf form, as uploaded and as the receiver reads it.
  std::string bytes;
  FUZZ_CHECK(flushable.backingStore().SerializeToString(&bytes), "the rewritten session does not serialise");
  corevireon::CVClientSession reread;
  FUZZ_CHECK(reread.ParseFromString(bytes), "the rewritten session does not decode");

  // JSON form, written the way the upload writes it. Strings that are not
  // UTF-8 are refused with an error line; anything written must read back.
  auto json = flushable.generateSessionJSON();
  std::ostringstream out;
  try {
    out << json;
  } catch (const nlohmann::json::exception&) {
    return 0;
  }
  auto parsed = nlohmann::ordered_json::parse(out.str(), nullptr, false);
  FUZZ_CHECK(!parsed.is_discarded() && parsed.is_object(), "the JSON upload does not read back");
  FUZZ_CHECK(parsed.contains("fb") && parsed["fb"].is_array(), "the JSON upload has no feedback list");
  return 0;
}
