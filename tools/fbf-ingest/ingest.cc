#include "ingest.h"

#include "upload/compressed_output_stream.h"

#include "corevireon.pb.h"

#include <asio.hpp>
#include <asio/ssl.hpp>
#include <google/protobuf/arena.h>
#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>
#include <nlohmann/json.hpp>
#include <openssl/evp.h>
#include <strings.h>
#include <zlib.h>

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <atomic>
#include <charconv>
#include <cmath>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <mutex>
#include <thread>
#include <unordered_map>

namespace fbf::ingest {
namespace {

using asio::awaitable;
using asio::use_awaitable;
using asio::ip::tcp;

constexpr size_t kMaxHeaderBytes = 64 * 1024;
constexpr size_t kMaxBodyBytes = 256 * 1024 * 1024;
constexpr size_t kArenaBlockBytes = 512 * 1024;

bool iequals(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

std::optional<std::string> headerValue(const ReceivedRequest& r, std::string_view name) {
  for (const auto& [k, v] : r.headers) {
    if (iequals(k, name)) return v;
  }
  return std::nullopt;
}

std::string hex(const unsigned char* p, size_t n) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  for (size_t i = 0; i < n; ++i) {
    out.push_back(kHex[p[i] >> 4]);
    out.push_back(kHex[p[i] & 0xf]);
  }
  return out;
}

// The digest the uploader's stream computes when `data` is written in
// pieces of `chunk` bytes (0: one write).
std::string perPassDigest(std::string_view data, size_t chunk) {
  CompressedOutputStream stream;
  stream.open();
  auto* p = reinterpret_cast<const uint8_t*>(data.data());
  if (chunk == 0) {
    stream.write(p, data.size());
  } else {
    for (size_t off = 0; off < data.size(); off += chunk) stream.write(p + off, std::min(chunk, data.size() - off));
  }
  stream.close();
  return stream.dataDigestForStream();
}

// The kind of digest `header` is for `inflated`, which arrived as `bodySize`
// compressed bytes. A one-write payload's digest is the SHA-512 of its bytes
// repeated once per compression pass, and every pass but the last fills the
// 4096-byte staging buffer, so there are at most bodySize / 4096 + 1 passes:
// hashing the payload again and again and comparing after each repetition
// recognises the plain digest (one pass) and every one-write digest at the
// cost of the hashing the sender did, without compressing anything. Only a
// digest that matches none of those is checked against the other write
// patterns by compressing the payload as the sender would have.
std::string digestKind(const std::string& header, std::string_view inflated, size_t bodySize) {
  const std::string& wanted = header;
  if (wanted.size() != 128) return "mismatch";
  size_t maxPasses = bodySize / CompressedOutputStream::kStagingBufferSize + 2;
  EVP_MD_CTX* ctx = EVP_MD_CTX_new();
  EVP_MD_CTX* probe = EVP_MD_CTX_new();
  // Fetched once: an implicit fetch on every initialisation costs a lookup
  // in the provider's tables.
  static EVP_MD* const sha512 = EVP_MD_fetch(nullptr, "SHA512", nullptr);
  EVP_DigestInit_ex(ctx, sha512 ? sha512 : EVP_sha512(), nullptr);
  std::string kind;
  for (size_t passes = 1; passes <= maxPasses && kind.empty(); ++passes) {
    EVP_DigestUpdate(ctx, inflated.data(), inflated.size());
    EVP_MD_CTX_copy_ex(probe, ctx);
    unsigned char md[64];
    unsigned int len = 0;
    EVP_DigestFinal_ex(probe, md, &len);
    if (hex(md, len) == wanted) kind = passes == 1 ? "sha512" : "passes/whole";
    // An empty payload hashes the same however often it is repeated.
    if (inflated.empty()) break;
  }
  EVP_MD_CTX_free(probe);
  EVP_MD_CTX_free(ctx);
  if (!kind.empty()) return kind;
  for (auto [chunk, name] : {std::pair<size_t, const char*>{1024, "passes/1024"}, {8192, "passes/8192"}}) {
    if (wanted == perPassDigest(inflated, chunk)) return name;
  }
  return "mismatch";
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

std::string percentDecode(std::string_view s) {
  std::string out;
  for (size_t i = 0; i < s.size(); ++i) {
    if (s[i] == '%' && i + 2 < s.size() && hexValue(s[i + 1]) >= 0 && hexValue(s[i + 2]) >= 0) {
      out.push_back(static_cast<char>(hexValue(s[i + 1]) * 16 + hexValue(s[i + 2])));
      i += 2;
    } else {
      out.push_back(s[i]);
    }
  }
  return out;
}

// ---- JSON text, written straight into the record line ----

constexpr char kHexDigits[] = "0123456789abcdef";

// Eight bytes at a time: strings are long runs of plain ASCII, and a word
// test finds the rare byte that needs a look of its own.
constexpr uint64_t kOnes = 0x0101010101010101u;
constexpr uint64_t kHighs = 0x8080808080808080u;

uint64_t load8(const char* p) {
  uint64_t w;
  std::memcpy(&w, p, sizeof w);
  return w;
}

// Whether a word holds a byte below 0x20, a '"', a '\\' or a byte above 0x7f.
bool needsLook(uint64_t w) {
  auto zeroByte = [](uint64_t x) { return (x - kOnes) & ~x & kHighs; };
  uint64_t control = (w - kOnes * 0x20) & ~w & kHighs;
  return ((w & kHighs) | control | zeroByte(w ^ (kOnes * '"')) | zeroByte(w ^ (kOnes * '\\'))) != 0;
}

// Whether `v` is well-formed UTF-8 (no overlong forms, no surrogates, nothing
// above U+10FFFF): what protobuf demands of proto3 strings.
bool validUtf8(std::string_view v) {
  auto* p = reinterpret_cast<const unsigned char*>(v.data());
  auto* end = p + v.size();
  while (p < end) {
    if (end - p >= 8 && (load8(reinterpret_cast<const char*>(p)) & kHighs) == 0) {
      p += 8;
      continue;
    }
    unsigned c = *p;
    if (c < 0x80) {
      ++p;
      continue;
    }
    size_t n;
    unsigned lo = 0x80, hi = 0xbf;
    if (c >= 0xc2 && c <= 0xdf) {
      n = 1;
    } else if (c >= 0xe0 && c <= 0xef) {
      n = 2;
      if (c == 0xe0) lo = 0xa0;
      if (c == 0xed) hi = 0x9f;
    } else if (c >= 0xf0 && c <= 0xf4) {
      n = 3;
      if (c == 0xf0) lo = 0x90;
      if (c == 0xf4) hi = 0x8f;
    } else {
      return false;
    }
    if (static_cast<size_t>(end - p) <= n) return false;
    if (p[1] < lo || p[1] > hi) return false;
    for (size_t k = 2; k <= n; ++k) {
      if ((p[k] & 0xc0) != 0x80) return false;
    }
    p += n + 1;
  }
  return true;
}

// A JSON string of `v`, escaped as the JSON library escapes (short escapes
// where JSON has them, \u00xx for other control characters, everything else
// as it is). The bytes are copied as they are: callers give valid UTF-8, or
// check it when this returns true, which it does when `v` is not all ASCII.
bool appendJsonString(std::string& out, std::string_view v) {
  bool nonAscii = false;
  out += '"';
  // Runs of characters that need no escape are copied whole.
  size_t start = 0;
  for (size_t k = 0; k < v.size(); ++k) {
    while (k + 8 <= v.size() && !needsLook(load8(v.data() + k))) k += 8;
    if (k == v.size()) break;
    auto u = static_cast<unsigned char>(v[k]);
    nonAscii |= u >= 0x80;
    if (u >= 0x20 && u != '"' && u != '\\') continue;
    out.append(v.data() + start, k - start);
    start = k + 1;
    switch (u) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      case '\b': out += "\\b"; break;
      case '\f': out += "\\f"; break;
      default:
        out += "\\u00";
        out += kHexDigits[u >> 4];
        out += kHexDigits[u & 0xf];
    }
  }
  out.append(v.data() + start, v.size() - start);
  out += '"';
  return nonAscii;
}

// A string the client chose (path, query, header, type): the rare one that
// is not UTF-8 goes through the JSON library, which replaces what is broken.
void appendClientString(std::string& out, std::string_view v) {
  if (validUtf8(v)) {
    appendJsonString(out, v);
  } else {
    out += nlohmann::json(std::string(v)).dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
  }
}

void appendDouble(std::string& out, double v) {
  if (std::isnan(v)) {
    out += "\"NaN\"";
  } else if (std::isinf(v)) {
    out += v > 0 ? "\"Infinity\"" : "\"-Infinity\"";
  } else {
    char buf[32];
    auto [end, ec] = std::to_chars(buf, buf + sizeof buf, v);
    out.append(buf, ec == std::errc() ? end : buf);
  }
}

void appendFloat(std::string& out, float v) {
  if (!std::isfinite(v)) return appendDouble(out, v);
  char buf[32];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, v);
  out.append(buf, ec == std::errc() ? end : buf);
}

template <typename T>
void appendInteger(std::string& out, T v, bool quoted) {
  char buf[24];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, v);
  if (quoted) out += '"';
  out.append(buf, end);
  if (quoted) out += '"';
}

void appendBase64(std::string& out, std::string_view v) {
  size_t at = out.size();
  out.resize(at + 4 * ((v.size() + 2) / 3) + 2);
  out[at] = '"';
  int n = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(out.data() + at + 1),
                          reinterpret_cast<const unsigned char*>(v.data()), static_cast<int>(v.size()));
  out.resize(at + 1 + static_cast<size_t>(std::max(n, 0)));
  out += '"';
}

// Compact JSON of a message in the proto3 JSON mapping (field names as in
// the .proto file, 64-bit integers and bytes as strings, enums by name,
// fields that are unset or at their default left out, fields in number
// order), through reflection over a parsed message. This is the reference
// form; `WirePrinter` below writes the same text faster for the usual case.
// The messages here use no well-known types, which would need their own
// mapping.
class ReflectionPrinter {
 public:
  explicit ReflectionPrinter(std::string& out) : out_(out) {}

  void message(const google::protobuf::Message& m) {
    const auto* reflection = m.GetReflection();
    std::vector<const google::protobuf::FieldDescriptor*> fields;
    reflection->ListFields(m, &fields);
    out_ += '{';
    bool first = true;
    for (const auto* field : fields) {
      if (!first) out_ += ',';
      first = false;
      appendJsonString(out_, field->name());
      out_ += ':';
      if (field->is_map()) {
        map(m, field);
      } else if (field->is_repeated()) {
        out_ += '[';
        int n = reflection->FieldSize(m, field);
        for (int i = 0; i < n; ++i) {
          if (i > 0) out_ += ',';
          value(m, field, i);
        }
        out_ += ']';
      } else {
        value(m, field, -1);
      }
    }
    out_ += '}';
  }

 private:
  void map(const google::protobuf::Message& m, const google::protobuf::FieldDescriptor* field) {
    const auto* reflection = m.GetReflection();
    const auto* keyField = field->message_type()->map_key();
    const auto* valueField = field->message_type()->map_value();
    out_ += '{';
    int n = reflection->FieldSize(m, field);
    for (int i = 0; i < n; ++i) {
      if (i > 0) out_ += ',';
      const auto& entry = reflection->GetRepeatedMessage(m, field, i);
      std::string key;
      ReflectionPrinter(key).value(entry, keyField, -1);
      if (key.empty() || key.front() != '"') {
        appendJsonString(out_, key);  // numbers and booleans are quoted as keys
      } else {
        out_ += key;
      }
      out_ += ':';
      value(entry, valueField, -1);
    }
    out_ += '}';
  }

  void value(const google::protobuf::Message& m, const google::protobuf::FieldDescriptor* f, int i) {
    using FD = google::protobuf::FieldDescriptor;
    const auto* r = m.GetReflection();
    const bool rep = i >= 0;
    switch (f->cpp_type()) {
      case FD::CPPTYPE_INT32: appendInteger(out_, rep ? r->GetRepeatedInt32(m, f, i) : r->GetInt32(m, f), false); break;
      case FD::CPPTYPE_UINT32: appendInteger(out_, rep ? r->GetRepeatedUInt32(m, f, i) : r->GetUInt32(m, f), false); break;
      case FD::CPPTYPE_INT64: appendInteger(out_, rep ? r->GetRepeatedInt64(m, f, i) : r->GetInt64(m, f), true); break;
      case FD::CPPTYPE_UINT64: appendInteger(out_, rep ? r->GetRepeatedUInt64(m, f, i) : r->GetUInt64(m, f), true); break;
      case FD::CPPTYPE_DOUBLE: appendDouble(out_, rep ? r->GetRepeatedDouble(m, f, i) : r->GetDouble(m, f)); break;
      case FD::CPPTYPE_FLOAT: appendFloat(out_, rep ? r->GetRepeatedFloat(m, f, i) : r->GetFloat(m, f)); break;
      case FD::CPPTYPE_BOOL: out_ += (rep ? r->GetRepeatedBool(m, f, i) : r->GetBool(m, f)) ? "true" : "false"; break;
      case FD::CPPTYPE_ENUM: {
        int v = rep ? r->GetRepeatedEnumValue(m, f, i) : r->GetEnumValue(m, f);
        if (const auto* e = f->enum_type()->FindValueByNumber(v)) {
          appendJsonString(out_, e->name());
        } else {
          appendInteger(out_, v, false);
        }
        break;
      }
      case FD::CPPTYPE_STRING: {
        std::string scratch;
        const std::string& v = rep ? r->GetRepeatedStringReference(m, f, i, &scratch) : r->GetStringReference(m, f, &scratch);
        if (f->type() == FD::TYPE_BYTES) {
          appendBase64(out_, v);
        } else {
          appendJsonString(out_, v);
        }
        break;
      }
      case FD::CPPTYPE_MESSAGE: message(rep ? r->GetRepeatedMessage(m, f, i) : r->GetMessage(m, f)); break;
    }
  }

  std::string& out_;
};

// What the wire printer knows of one message type: its fields by number,
// each with its key already written as JSON.
struct WireField;
struct WireMessage {
  std::vector<const WireField*> byNumber;  // null where no field has the number
  std::vector<std::unique_ptr<WireField>> fields;
  bool supported = true;  // false for groups and the like, which it leaves to reflection
};

struct WireField {
  const google::protobuf::FieldDescriptor* descriptor = nullptr;
  // The descriptor resolves its type lazily, behind a once-flag, on every call.
  google::protobuf::FieldDescriptor::Type type = google::protobuf::FieldDescriptor::TYPE_INT32;
  std::string key;  // "name":
  int wireType = 0;
  bool repeated = false;
  bool packable = false;  // a repeated number, which may come packed
  bool map = false;       // entries of `message`, each a key (1) and a value (2)
  bool presence = false;  // printed even at its default value
  int oneof = -1;         // index of a real oneof, at most one of whose fields may be set
  const WireMessage* message = nullptr;
  std::vector<std::string> enumNames;  // by value, JSON-quoted; empty where the value has no name
};

// The tables of the uploaded message types, built once. Field numbers of the
// uploaded messages are small, so a field is found by indexing.
class WireSchema {
 public:
  static const WireSchema& instance() {
    static const WireSchema schema;
    return schema;
  }
  const WireMessage* find(const google::protobuf::Descriptor* d) const {
    auto it = messages_.find(d);
    return it == messages_.end() || !it->second->supported ? nullptr : it->second.get();
  }

 private:
  static constexpr int kMaxIndexedNumber = 4096;
  static constexpr int kMaxIndexedEnumValue = 1024;

  WireSchema() {
    build(corevireon::CVClientSession::descriptor());
    build(corevireon::CVCohortsFeedback::descriptor());
  }

  WireMessage* build(const google::protobuf::Descriptor* d) {
    using FD = google::protobuf::FieldDescriptor;
    if (auto it = messages_.find(d); it != messages_.end()) return it->second.get();
    auto& slot = messages_[d];
    slot = std::make_unique<WireMessage>();
    WireMessage* m = slot.get();
    if (d->real_oneof_decl_count() > 64) m->supported = false;
    for (int i = 0; i < d->field_count(); ++i) {
      const FD* fd = d->field(i);
      if (fd->number() > kMaxIndexedNumber || fd->type() == FD::TYPE_GROUP) {
        m->supported = false;
        continue;
      }
      auto f = std::make_unique<WireField>();
      f->descriptor = fd;
      f->type = fd->type();
      appendJsonString(f->key, fd->name());
      f->key += ':';
      f->repeated = fd->is_repeated();
      f->presence = fd->has_presence();
      f->oneof = fd->real_containing_oneof() ? fd->real_containing_oneof()->index() : -1;
      switch (fd->type()) {
        case FD::TYPE_DOUBLE: case FD::TYPE_FIXED64: case FD::TYPE_SFIXED64: f->wireType = 1; break;
        case FD::TYPE_FLOAT: case FD::TYPE_FIXED32: case FD::TYPE_SFIXED32: f->wireType = 5; break;
        case FD::TYPE_STRING: case FD::TYPE_BYTES: case FD::TYPE_MESSAGE: f->wireType = 2; break;
        default: f->wireType = 0; break;
      }
      f->packable = f->repeated && f->wireType != 2;
      f->map = fd->is_map();
      if (fd->type() == FD::TYPE_MESSAGE) {
        const WireMessage* sub = build(fd->message_type());
        f->message = sub;
      }
      if (fd->type() == FD::TYPE_ENUM) {
        const auto* e = fd->enum_type();
        for (int k = 0; k < e->value_count(); ++k) {
          int number = e->value(k)->number();
          if (number < 0 || number > kMaxIndexedEnumValue) {
            m->supported = false;
            continue;
          }
          if (static_cast<size_t>(number) >= f->enumNames.size()) f->enumNames.resize(static_cast<size_t>(number) + 1);
          // The first value of a number is the one reflection names.
          if (f->enumNames[static_cast<size_t>(number)].empty()) {
            appendJsonString(f->enumNames[static_cast<size_t>(number)], e->FindValueByNumber(number)->name());
          }
        }
      }
      if (static_cast<size_t>(fd->number()) >= m->byNumber.size()) m->byNumber.resize(static_cast<size_t>(fd->number()) + 1);
      m->byNumber[static_cast<size_t>(fd->number())] = f.get();
      m->fields.push_back(std::move(f));
    }
    return m;
  }

  std::unordered_map<const google::protobuf::Descriptor*, std::unique_ptr<WireMessage>> messages_;
};

// The same JSON as `ReflectionPrinter`, written while walking the protobuf
// wire format, without building the message: parsing a session into
// thousands of small objects and reading them back through reflection was
// most of this receiver's work. It takes only what protobuf's parser would
// accept and reflection would print the same way: fields in ascending
// number order, each singular field once, at most one field of a oneof,
// known fields with their declared wire type, well-formed UTF-8 in strings,
// no groups, moderate nesting. That is what a protobuf serialiser writes.
// Anything else (it returns false) goes to the parser and reflection, which
// decide, so the record says the same either way.
class WirePrinter {
 public:
  explicit WirePrinter(std::string& out) : out_(out) {}

  bool message(const WireMessage& m, const uint8_t* p, const uint8_t* end, int depth = 0) {
    if (depth > kMaxDepth) return false;
    out_ += '{';
    bool first = true;
    uint32_t lastNumber = 0;
    const WireField* open = nullptr;  // the repeated field whose array is open
    bool openHasElements = false;
    uint64_t oneofsSeen = 0;
    std::vector<std::string> mapKeys;  // of the open map, as written
    auto closeArray = [&] {
      if (open && openHasElements) out_ += open->map ? '}' : ']';
      open = nullptr;
    };
    while (p < end) {
      uint64_t tag;
      if (!varint(p, end, tag) || tag > UINT32_MAX) return false;
      auto number = static_cast<uint32_t>(tag >> 3);
      int wireType = static_cast<int>(tag & 7);
      if (number == 0) return false;
      const WireField* f = number < m.byNumber.size() ? m.byNumber[number] : nullptr;
      if (!f) {
        if (!skip(wireType, p, end)) return false;
        continue;
      }
      if (number < lastNumber || (number == lastNumber && !f->repeated)) return false;
      if (number != lastNumber) {
        closeArray();
        if (f->oneof >= 0) {
          if (oneofsSeen & (uint64_t{1} << f->oneof)) return false;
          oneofsSeen |= uint64_t{1} << f->oneof;
        }
        lastNumber = number;
      }
      if (f->repeated) {
        if (open != f) {
          open = f;
          openHasElements = false;
          mapKeys.clear();
        }
        auto element = [&]() {
          if (!openHasElements) {
            if (!first) out_ += ',';
            first = false;
            out_ += f->key;
            out_ += f->map ? '{' : '[';
            openHasElements = true;
          } else {
            out_ += ',';
          }
        };
        if (wireType == 2 && f->packable) {
          const uint8_t* packedEnd;
          if (!delimited(p, end, packedEnd)) return false;
          while (p < packedEnd) {
            element();
            bool isDefault;
            if (!value(*f, f->wireType, p, packedEnd, depth, isDefault)) return false;
          }
        } else if (f->map) {
          if (wireType != 2) return false;
          element();
          if (!mapEntry(*f, p, end, depth, mapKeys)) return false;
        } else {
          if (wireType != f->wireType) return false;
          element();
          bool isDefault;
          if (!value(*f, wireType, p, end, depth, isDefault)) return false;
        }
      } else {
        if (wireType != f->wireType) return false;
        size_t mark = out_.size();
        if (!first) out_ += ',';
        out_ += f->key;
        bool isDefault;
        if (!value(*f, wireType, p, end, depth, isDefault)) return false;
        if (isDefault && !f->presence) {
          out_.resize(mark);  // a field without presence at its default is not set
        } else {
          first = false;
        }
      }
    }
    closeArray();
    out_ += '}';
    return true;
  }

 private:
  static constexpr int kMaxDepth = 64;
  static constexpr size_t kMaxMapEntries = 256;

  static bool varint(const uint8_t*& p, const uint8_t* end, uint64_t& v) {
    v = 0;
    for (int shift = 0; shift < 70; shift += 7) {
      if (p == end) return false;
      uint8_t b = *p++;
      if (shift == 63 && b > 1) return false;  // more than 64 bits: left to the parser
      v |= static_cast<uint64_t>(b & 0x7f) << shift;
      if (!(b & 0x80)) return true;
    }
    return false;
  }

  static bool delimited(const uint8_t*& p, const uint8_t* end, const uint8_t*& contentEnd) {
    uint64_t length;
    if (!varint(p, end, length) || length > static_cast<uint64_t>(end - p) || length > INT32_MAX) return false;
    contentEnd = p + length;
    return true;
  }

  static bool skip(int wireType, const uint8_t*& p, const uint8_t* end) {
    uint64_t ignored;
    const uint8_t* contentEnd;
    switch (wireType) {
      case 0: return varint(p, end, ignored);
      case 1: if (end - p < 8) return false; p += 8; return true;
      case 5: if (end - p < 4) return false; p += 4; return true;
      case 2: if (!delimited(p, end, contentEnd)) return false; p = contentEnd; return true;
      default: return false;  // groups and invalid wire types
    }
  }

  // One map entry as `"key":value`. Taken only as a serialiser writes it:
  // the key, then the value, each once, and no key twice in the map. The
  // entries come in the order sent, where reflection gives them in the
  // map's own order: the same JSON object.
  bool mapEntry(const WireField& f, const uint8_t*& p, const uint8_t* end, int depth, std::vector<std::string>& keys) {
    const uint8_t* entryEnd;
    if (!f.message || !delimited(p, end, entryEnd)) return false;
    const auto& entry = f.message->byNumber;
    const WireField* keyField = entry.size() > 2 ? entry[1] : nullptr;
    const WireField* valueField = entry.size() > 2 ? entry[2] : nullptr;
    if (!keyField || !valueField || keys.size() >= kMaxMapEntries) return false;
    uint64_t tag;
    bool isDefault;
    if (!varint(p, entryEnd, tag) || tag != (8u | static_cast<unsigned>(keyField->wireType))) return false;
    size_t mark = out_.size();
    if (!value(*keyField, keyField->wireType, p, entryEnd, depth, isDefault)) return false;
    if (out_[mark] != '"') {  // numbers and booleans are quoted as keys
      std::string key = out_.substr(mark);
      out_.resize(mark);
      appendJsonString(out_, key);
    }
    std::string_view written(out_.data() + mark, out_.size() - mark);
    for (const auto& k : keys) {
      if (k == written) return false;  // the last value would win
    }
    keys.emplace_back(written);
    out_ += ':';
    if (!varint(p, entryEnd, tag) || tag != (16u | static_cast<unsigned>(valueField->wireType))) return false;
    if (!value(*valueField, valueField->wireType, p, entryEnd, depth + 1, isDefault)) return false;
    return p == entryEnd;
  }

  template <typename T>
  static bool fixed(const uint8_t*& p, const uint8_t* end, T& v) {
    if (static_cast<size_t>(end - p) < sizeof v) return false;
    std::memcpy(&v, p, sizeof v);  // little-endian, as this machine
    p += sizeof v;
    return true;
  }

  bool value(const WireField& f, int wireType, const uint8_t*& p, const uint8_t* end, int depth, bool& isDefault) {
    using FD = google::protobuf::FieldDescriptor;
    uint64_t v = 0;
    if (wireType == 0 && !varint(p, end, v)) return false;
    isDefault = v == 0;
    switch (f.type) {
      case FD::TYPE_INT32: isDefault = static_cast<int32_t>(v) == 0; appendInteger(out_, static_cast<int32_t>(v), false); break;
      case FD::TYPE_INT64: appendInteger(out_, static_cast<int64_t>(v), true); break;
      case FD::TYPE_UINT32: isDefault = static_cast<uint32_t>(v) == 0; appendInteger(out_, static_cast<uint32_t>(v), false); break;
      case FD::TYPE_UINT64: appendInteger(out_, v, true); break;
      case FD::TYPE_SINT32: {
        auto u = static_cast<uint32_t>(v);
        isDefault = u == 0;
        appendInteger(out_, static_cast<int32_t>((u >> 1) ^ (~(u & 1) + 1)), false);
        break;
      }
      case FD::TYPE_SINT64: appendInteger(out_, static_cast<int64_t>((v >> 1) ^ (~(v & 1) + 1)), true); break;
      case FD::TYPE_BOOL:
        if (v > 1) return false;  // how wide the parser reads it is its business
        out_ += v ? "true" : "false";
        break;
      case FD::TYPE_ENUM: {
        auto e = static_cast<int32_t>(v);
        isDefault = e == 0;
        if (e >= 0 && static_cast<size_t>(e) < f.enumNames.size() && !f.enumNames[static_cast<size_t>(e)].empty()) {
          out_ += f.enumNames[static_cast<size_t>(e)];
        } else {
          appendInteger(out_, e, false);
        }
        break;
      }
      case FD::TYPE_FIXED32: { uint32_t x; if (!fixed(p, end, x)) return false; isDefault = x == 0; appendInteger(out_, x, false); break; }
      case FD::TYPE_SFIXED32: { int32_t x; if (!fixed(p, end, x)) return false; isDefault = x == 0; appendInteger(out_, x, false); break; }
      case FD::TYPE_FIXED64: { uint64_t x; if (!fixed(p, end, x)) return false; isDefault = x == 0; appendInteger(out_, x, true); break; }
      case FD::TYPE_SFIXED64: { int64_t x; if (!fixed(p, end, x)) return false; isDefault = x == 0; appendInteger(out_, x, true); break; }
      case FD::TYPE_FLOAT: {
        uint32_t bits; if (!fixed(p, end, bits)) return false;
        // Whether reflection counts -0 as set has varied between versions.
        if (bits == 0x80000000u && !f.presence && !f.repeated) return false;
        isDefault = bits == 0;
        float x; std::memcpy(&x, &bits, sizeof x);
        appendFloat(out_, x);
        break;
      }
      case FD::TYPE_DOUBLE: {
        uint64_t bits; if (!fixed(p, end, bits)) return false;
        if (bits == 0x8000000000000000u && !f.presence && !f.repeated) return false;
        isDefault = bits == 0;
        double x; std::memcpy(&x, &bits, sizeof x);
        appendDouble(out_, x);
        break;
      }
      case FD::TYPE_STRING:
      case FD::TYPE_BYTES: {
        const uint8_t* contentEnd;
        if (!delimited(p, end, contentEnd)) return false;
        std::string_view s(reinterpret_cast<const char*>(p), static_cast<size_t>(contentEnd - p));
        p = contentEnd;
        isDefault = s.empty();
        if (f.type == FD::TYPE_BYTES) {
          appendBase64(out_, s);
        } else {
          if (appendJsonString(out_, s) && !validUtf8(s)) return false;
        }
        break;
      }
      case FD::TYPE_MESSAGE: {
        const uint8_t* contentEnd;
        if (!f.message || !f.message->supported || !delimited(p, end, contentEnd)) return false;
        isDefault = false;  // a message field is set once it is sent
        if (!message(*f.message, p, contentEnd, depth + 1)) return false;
        p = contentEnd;
        break;
      }
      default: return false;
    }
    return true;
  }

  std::string& out_;
};

// Appends the JSON of `payload` as a `Message`; false (and nothing appended)
// when it is not one.
template <typename Message>
bool appendDecoded(std::string& out, std::string_view payload) {
  size_t mark = out.size();
  if (const WireMessage* table = WireSchema::instance().find(Message::descriptor())) {
    auto* p = reinterpret_cast<const uint8_t*>(payload.data());
    if (WirePrinter(out).message(*table, p, p + payload.size())) return true;
    out.resize(mark);
  }
  // Decoded messages live in an arena over a block kept per thread: a
  // session is thousands of small messages, each otherwise its own
  // allocation.
  thread_local std::unique_ptr<char[]> arenaBlock = std::make_unique_for_overwrite<char[]>(kArenaBlockBytes);
  google::protobuf::ArenaOptions arenaOptions;
  arenaOptions.initial_block = arenaBlock.get();
  arenaOptions.initial_block_size = kArenaBlockBytes;
  google::protobuf::Arena arena(arenaOptions);
  auto* message = google::protobuf::Arena::CreateMessage<Message>(&arena);
  if (!message->ParseFromArray(payload.data(), static_cast<int>(payload.size()))) return false;
  ReflectionPrinter(out).message(*message);
  return true;
}

// A JSON body as one line of record: validated without building it, then
// copied with its line breaks made spaces (valid JSON has raw line breaks
// only between tokens, where any white space will do).
bool appendJsonBodyAsLine(std::string& out, std::string_view body) {
  if (!nlohmann::json::accept(body)) return false;
  size_t at = out.size();
  out.append(body);
  for (size_t i = at; i < out.size(); ++i) {
    if (out[i] == '\n' || out[i] == '\r') out[i] = ' ';
  }
  return true;
}

// Raw DEFLATE into a scratch buffer kept per thread, so that a request costs
// neither the clearing of a fresh buffer nor its page faults. The view is
// valid until the thread inflates again. The inflater is kept too, and reset
// per body; asking it to finish in one call spares it from copying the last
// 32 KB of the output into its window, which only a later call would need.
std::optional<std::string_view> inflateToScratch(std::string_view compressed) {
  struct Inflater {
    z_stream z{};
    bool live = false;
    Inflater() { live = inflateInit2(&z, -15) == Z_OK; }
    ~Inflater() {
      if (live) inflateEnd(&z);
    }
  };
  thread_local Inflater inflater;
  thread_local std::unique_ptr<char[]> scratch;
  thread_local size_t scratchSize = 0;
  z_stream& z = inflater.z;
  if (!inflater.live || inflateReset(&z) != Z_OK) return std::nullopt;
  size_t produced = 0;
  z.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  z.avail_in = static_cast<uInt>(compressed.size());
  int rc = Z_OK;
  while (rc == Z_OK) {
    if (produced == scratchSize) {
      size_t size = std::max<size_t>({scratchSize * 2, compressed.size() * 4, 256 * 1024});
      auto grown = std::make_unique_for_overwrite<char[]>(size);
      if (produced > 0) std::memcpy(grown.get(), scratch.get(), produced);
      scratch = std::move(grown);
      scratchSize = size;
    }
    size_t room = std::min<size_t>(scratchSize - produced, 1u << 30);
    z.next_out = reinterpret_cast<Bytef*>(scratch.get() + produced);
    z.avail_out = static_cast<uInt>(room);
    rc = inflate(&z, Z_FINISH);
    produced += room - z.avail_out;
    if (rc == Z_BUF_ERROR) {
      // Unfinished: with room left the stream is cut short, without it the
      // buffer grows and inflating goes on.
      if (z.avail_out != 0) break;
      rc = Z_OK;
    }
  }
  bool complete = rc == Z_STREAM_END && z.avail_in == 0;
  if (!complete) return std::nullopt;
  return std::string_view(scratch.get(), produced);
}

// A JSON object written member by member, keys in the order given.
class ObjectWriter {
 public:
  explicit ObjectWriter(std::string& out) : out_(out) { out_ += '{'; }
  std::string& key(std::string_view k) {
    if (!first_) out_ += ',';
    first_ = false;
    appendJsonString(out_, k);
    out_ += ':';
    return out_;
  }
  void close() { out_ += '}'; }

 private:
  std::string& out_;
  bool first_ = true;
};

// Members of a JSON object as the JSON library's ordered object keeps them:
// a name given twice keeps its first place and its last value.
using OrderedMembers = std::vector<std::pair<std::string, std::optional<std::string>>>;

void setMember(OrderedMembers& members, std::string name, std::optional<std::string> value) {
  for (auto& [k, v] : members) {
    if (k == name) {
      v = std::move(value);
      return;
    }
  }
  members.emplace_back(std::move(name), std::move(value));
}

void appendMembers(std::string& out, const OrderedMembers& members) {
  out += '{';
  bool first = true;
  for (const auto& [k, v] : members) {
    if (!first) out += ',';
    first = false;
    appendClientString(out, k);
    out += ':';
    if (v) {
      appendClientString(out, *v);
    } else {
      out += "null";
    }
  }
  out += '}';
}

}  // namespace

std::optional<std::string> inflateRaw(const std::string& compressed) {
  auto view = inflateToScratch(compressed);
  if (!view) return std::nullopt;
  return std::string(*view);
}

void describeRequest(const ReceivedRequest& request, std::string& line) {
  line.clear();
  line += "{\"method\":";
  appendClientString(line, request.method);
  std::string_view target = request.target;
  auto q = target.find('?');
  line += ",\"path\":";
  appendClientString(line, target.substr(0, q));
  OrderedMembers query;
  std::string type;
  if (q != std::string_view::npos) {
    std::string_view rest = target.substr(q + 1);
    while (!rest.empty()) {
      auto amp = rest.find('&');
      auto piece = rest.substr(0, amp);
      rest = amp == std::string_view::npos ? std::string_view() : rest.substr(amp + 1);
      if (piece.empty()) continue;
      auto eq = piece.find('=');
      auto name = percentDecode(piece.substr(0, eq));
      if (eq == std::string_view::npos) {
        setMember(query, std::move(name), std::nullopt);
      } else {
        auto value = percentDecode(piece.substr(eq + 1));
        if (name == "type") type = value;
        setMember(query, std::move(name), std::move(value));
      }
    }
  }
  line += ",\"query\":";
  appendMembers(line, query);
  OrderedMembers headers;
  for (const auto& [k, v] : request.headers) setMember(headers, k, v);
  line += ",\"headers\":";
  appendMembers(line, headers);
  line += ",\"body_size\":";
  appendInteger(line, request.body.size(), false);

  auto inflated = inflateToScratch(request.body);
  line += ",\"inflated_size\":";
  if (inflated) {
    appendInteger(line, inflated->size(), false);
  } else {
    line += "null";
  }

  std::string kind = "missing";
  if (auto digest = headerValue(request, "X-Corvane-Digest"); digest && inflated) {
    kind = digestKind(*digest, *inflated, request.body.size());
  } else if (digest) {
    kind = "mismatch";
  }
  line += ",\"digest_ok\":";
  line += kind != "missing" && kind != "mismatch" ? "true" : "false";
  line += ",\"digest_kind\":";
  appendJsonString(line, kind);
  line += ",\"type\":";
  appendClientString(line, type);

  // The decoded body is written in place; a message's JSON is about two and
  // a half times its payload, so room for it is made once.
  line += ",\"decoded\":";
  size_t decodedAt = line.size();
  std::string error;
  if (!inflated) {
    error = "the body is not a raw DEFLATE stream";
  } else if (type == "FeedbackV2PB") {
    line.reserve(line.size() + inflated->size() * 3 + 256);
    if (!appendDecoded<corevireon::CVClientSession>(line, *inflated)) error = "not a CVClientSession";
  } else if (iequals(type, "Usage")) {
    line.reserve(line.size() + inflated->size() * 3 + 256);
    if (!appendDecoded<corevireon::CVCohortsFeedback>(line, *inflated)) error = "not a CVCohortsFeedback";
  } else if (auto ct = headerValue(request, "Content-Type"); ct && iequals(*ct, "application/protobuf")) {
    // Protobuf of a type this receiver has no message for: recorded by size only.
    error = "no message known for type " + type;
  } else {
    if (!appendJsonBodyAsLine(line, *inflated)) error = "not JSON";
  }
  if (line.size() == decodedAt) line += "null";
  if (!error.empty()) {
    line += ",\"decode_error\":";
    appendClientString(line, error);
  }
}

void finishLine(std::string& line, int status) {
  line += ",\"status\":";
  appendInteger(line, status, false);
  line += "}\n";
}

void finishLineDropped(std::string& line) { line += ",\"status\":\"dropped\"}\n"; }

namespace {

struct Options {
  std::string host = "127.0.0.1";
  unsigned short port = 0;
  std::optional<std::pair<std::string, std::string>> tls;
  std::optional<std::string> record;
  std::vector<int> statuses;
  int delayMs = 0;
  bool drop = false;
  std::optional<std::string> portFile;
};

int usage(const std::string& why) {
  std::cerr << "fbf-ingest: " << why << "\n"
            << "usage: fbf-ingest --listen HOST:PORT [--tls CERT KEY] [--record FILE] [--status CODE ...]\n"
            << "                  [--delay-ms N] [--drop] [--port-file FILE]\n";
  return 2;
}

std::optional<int> parseInt(const std::string& s) {
  try {
    size_t pos = 0;
    int v = std::stoi(s, &pos);
    if (pos != s.size()) return std::nullopt;
    return v;
  } catch (...) {
    return std::nullopt;
  }
}

const char* reason(int code) {
  switch (code) {
    case 200: return "OK";
    case 201: return "Created";
    case 204: return "No Content";
    case 400: return "Bad Request";
    case 404: return "Not Found";
    case 500: return "Internal Server Error";
    case 503: return "Service Unavailable";
    default: return "Status";
  }
}

// Connections are served concurrently, on as many threads as there are
// cores; the record and the answer counter are the only shared state.
class Server {
 public:
  explicit Server(Options options) : options_(std::move(options)) {
    if (options_.record) {
      recordFd_ = ::open(options_.record->c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
      if (recordFd_ < 0) throw std::runtime_error("cannot open the record file " + *options_.record);
    }
  }
  ~Server() {
    if (recordFd_ != STDOUT_FILENO) ::close(recordFd_);
  }
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  const Options& options() const { return options_; }

  int nextStatus() {
    if (options_.statuses.empty()) return 200;
    size_t i = std::min(answered_.fetch_add(1), options_.statuses.size() - 1);
    return options_.statuses[i];
  }

  // One write per line, done before the request is answered, so that a
  // client that has its answer finds the line in the record. The lock keeps
  // lines whole when they go to a pipe.
  void record(const std::string& line) {
    std::lock_guard lock(recordLock_);
    size_t done = 0;
    while (done < line.size()) {
      ssize_t n = ::write(recordFd_, line.data() + done, line.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        std::cerr << "fbf-ingest: cannot write the record: " << std::strerror(errno) << std::endl;
        return;
      }
      done += static_cast<size_t>(n);
    }
  }

  template <typename Stream>
  awaitable<void> serve(Stream& stream, tcp::socket& socket) {
    std::string buffer;
    // The record line is built here, and its room kept from one request of
    // the connection to the next.
    std::string line;
    while (true) {
      size_t headerEnd = co_await asio::async_read_until(stream, asio::dynamic_buffer(buffer, kMaxHeaderBytes),
                                                         "\r\n\r\n", use_awaitable);
      ReceivedRequest request;
      std::string head = buffer.substr(0, headerEnd);
      buffer.erase(0, headerEnd);
      if (!parseHead(head, request)) co_return;

      if (auto expect = headerValue(request, "Expect"); expect && iequals(*expect, "100-continue")) {
        static const std::string kContinue = "HTTP/1.1 100 Continue\r\n\r\n";
        co_await asio::async_write(stream, asio::buffer(kContinue), use_awaitable);
      }
      auto te = headerValue(request, "Transfer-Encoding");
      if (te && iequals(*te, "chunked")) {
        co_await readChunked(stream, buffer, request.body);
      } else {
        size_t length = 0;
        if (auto cl = headerValue(request, "Content-Length")) length = std::stoull(*cl);
        if (length > kMaxBodyBytes) co_return;
        if (buffer.size() < length) {
          co_await asio::async_read(stream, asio::dynamic_buffer(buffer), asio::transfer_exactly(length - buffer.size()),
                                    use_awaitable);
        }
        request.body = buffer.substr(0, length);
        buffer.erase(0, length);
      }

      describeRequest(request, line);
      if (options_.delayMs > 0) {
        asio::steady_timer timer(socket.get_executor(), std::chrono::milliseconds(options_.delayMs));
        co_await timer.async_wait(use_awaitable);
      }
      if (options_.drop) {
        finishLineDropped(line);
        record(line);
        std::error_code ec;
        socket.shutdown(tcp::socket::shutdown_both, ec);
        socket.close(ec);
        co_return;
      }
      int status = nextStatus();
      finishLine(line, status);
      record(line);
      bool close = false;
      if (auto c = headerValue(request, "Connection"); c && iequals(*c, "close")) close = true;
      std::string response = "HTTP/1.1 " + std::to_string(status) + " " + reason(status) + "\r\n";
      if (status != 204) response += "Content-Length: 0\r\n";
      response += close ? "Connection: close\r\n\r\n" : "\r\n";
      co_await asio::async_write(stream, asio::buffer(response), use_awaitable);
      if (close) co_return;
    }
  }

 private:
  static bool parseHead(const std::string& head, ReceivedRequest& r) {
    std::string_view rest = head;
    auto eol = rest.find("\r\n");
    std::string_view first = rest.substr(0, eol);
    rest = rest.substr(eol + 2);
    auto sp1 = first.find(' ');
    auto sp2 = first.rfind(' ');
    if (sp1 == std::string_view::npos || sp2 == sp1) return false;
    r.method = std::string(first.substr(0, sp1));
    r.target = std::string(first.substr(sp1 + 1, sp2 - sp1 - 1));
    while (!rest.empty()) {
      eol = rest.find("\r\n");
      std::string_view line = rest.substr(0, eol);
      rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 2);
      if (line.empty()) break;
      auto colon = line.find(':');
      if (colon == std::string_view::npos) return false;
      auto value = line.substr(colon + 1);
      while (!value.empty() && (value.front() == ' ' || value.front() == '\t')) value.remove_prefix(1);
      while (!value.empty() && (value.back() == ' ' || value.back() == '\t')) value.remove_suffix(1);
      r.headers.emplace_back(std::string(line.substr(0, colon)), std::string(value));
    }
    return true;
  }

  template <typename Stream>
  awaitable<void> readLine(Stream& stream, std::string& buffer, std::string& line) {
    size_t n = co_await asio::async_read_until(stream, asio::dynamic_buffer(buffer, kMaxBodyBytes), "\r\n",
                                               use_awaitable);
    line = buffer.substr(0, n - 2);
    buffer.erase(0, n);
  }

  template <typename Stream>
  awaitable<void> readChunked(Stream& stream, std::string& buffer, std::string& body) {
    std::string line;
    while (true) {
      co_await readLine(stream, buffer, line);
      size_t size = std::stoull(line.substr(0, line.find(';')), nullptr, 16);
      if (size == 0) break;
      if (body.size() + size > kMaxBodyBytes) throw std::runtime_error("body too large");
      if (buffer.size() < size + 2) {
        co_await asio::async_read(stream, asio::dynamic_buffer(buffer), asio::transfer_exactly(size + 2 - buffer.size()),
                                  use_awaitable);
      }
      body.append(buffer, 0, size);
      buffer.erase(0, size + 2);
    }
    do {  // trailers, up to the empty line
      co_await readLine(stream, buffer, line);
    } while (!line.empty());
  }

  Options options_;
  int recordFd_ = STDOUT_FILENO;
  std::mutex recordLock_;
  std::atomic<size_t> answered_{0};
};

awaitable<void> handlePlain(Server& server, tcp::socket socket) {
  try {
    co_await server.serve(socket, socket);
  } catch (const std::exception&) {
    // The peer went away or sent something unreadable; the connection ends.
  }
}

awaitable<void> handleTLS(Server& server, asio::ssl::context& context, tcp::socket socket) {
  asio::ssl::stream<tcp::socket> stream(std::move(socket), context);
  try {
    co_await stream.async_handshake(asio::ssl::stream_base::server, use_awaitable);
    co_await server.serve(stream, stream.next_layer());
  } catch (const std::exception&) {
    // Failed handshakes (a client refusing our key) end here.
  }
}

awaitable<void> acceptLoop(Server& server, tcp::acceptor& acceptor, asio::ssl::context* tls) {
  while (true) {
    tcp::socket socket = co_await acceptor.async_accept(use_awaitable);
    std::error_code ignored;
    socket.set_option(tcp::no_delay(true), ignored);  // answers are small and must not wait
    if (tls) {
      asio::co_spawn(acceptor.get_executor(), handleTLS(server, *tls, std::move(socket)), asio::detached);
    } else {
      asio::co_spawn(acceptor.get_executor(), handlePlain(server, std::move(socket)), asio::detached);
    }
  }
}

}  // namespace

int run(int argc, char** argv) {
  Options options;
  bool haveListen = false;
  std::vector<std::string> args(argv + 1, argv + argc);
  for (size_t i = 0; i < args.size(); ++i) {
    const auto& a = args[i];
    auto needs = [&](size_t n) { return i + n < args.size(); };
    if (a == "--listen" && needs(1)) {
      auto spec = args[++i];
      auto colon = spec.rfind(':');
      auto port = colon == std::string::npos ? std::nullopt : parseInt(spec.substr(colon + 1));
      if (!port || *port < 0 || *port > 65535) return usage("--listen needs HOST:PORT");
      options.host = spec.substr(0, colon);
      options.port = static_cast<unsigned short>(*port);
      haveListen = true;
    } else if (a == "--tls" && needs(2)) {
      options.tls = std::make_pair(args[i + 1], args[i + 2]);
      i += 2;
    } else if (a == "--record" && needs(1)) {
      options.record = args[++i];
    } else if (a == "--status") {
      while (i + 1 < args.size() && !args[i + 1].starts_with("--")) {
        auto code = parseInt(args[++i]);
        if (!code || *code < 100 || *code > 999) return usage("bad status code " + args[i]);
        options.statuses.push_back(*code);
      }
      if (options.statuses.empty()) return usage("--status needs at least one code");
    } else if (a == "--delay-ms" && needs(1)) {
      auto ms = parseInt(args[++i]);
      if (!ms || *ms < 0) return usage("bad --delay-ms");
      options.delayMs = *ms;
    } else if (a == "--drop") {
      options.drop = true;
    } else if (a == "--port-file" && needs(1)) {
      options.portFile = args[++i];
    } else if (a == "--help" || a == "-h") {
      usage("a reference receiver for feedback uploads");
      return 0;
    } else {
      return usage("unknown or incomplete argument " + a);
    }
  }
  if (!haveListen) return usage("--listen is required");
  // Request buffers of a few hundred kilobytes come and go all the time:
  // keep them in the heap instead of mapping and unmapping them each time.
  mallopt(M_MMAP_THRESHOLD, 64 * 1024 * 1024);
  mallopt(M_TRIM_THRESHOLD, 256 * 1024 * 1024);

  try {
    unsigned threads = std::max(1u, std::thread::hardware_concurrency());
    asio::io_context io(static_cast<int>(threads));
    std::unique_ptr<asio::ssl::context> tls;
    if (options.tls) {
      tls = std::make_unique<asio::ssl::context>(asio::ssl::context::tls_server);
      tls->set_options(asio::ssl::context::default_workarounds | asio::ssl::context::no_sslv2 |
                       asio::ssl::context::no_sslv3);
      tls->use_certificate_chain_file(options.tls->first);
      tls->use_private_key_file(options.tls->second, asio::ssl::context::pem);
    }
    tcp::endpoint endpoint(asio::ip::make_address(options.host), options.port);
    tcp::acceptor acceptor(io, endpoint);
    unsigned short port = acceptor.local_endpoint().port();
    if (options.portFile) {
      std::string tmp = *options.portFile + ".tmp";
      {
        std::ofstream out(tmp, std::ios::trunc);
        out << port << "\n";
      }
      std::filesystem::rename(tmp, *options.portFile);
    }
    std::cerr << "fbf-ingest: listening on " << options.host << ":" << port << (tls ? " (https)" : " (http)")
              << std::endl;
    Server server(options);
    asio::signal_set signals(io, SIGINT, SIGTERM);
    signals.async_wait([&](const std::error_code&, int) { io.stop(); });
    asio::co_spawn(io, acceptLoop(server, acceptor, tls.get()), asio::detached);
    std::vector<std::thread> helpers;
    for (unsigned i = 1; i < threads; ++i) helpers.emplace_back([&io] { io.run(); });
    io.run();
    for (auto& t : helpers) t.join();
  } catch (const std::exception& e) {
    std::cerr << "fbf-ingest: " << e.what() << std::endl;
    return 1;
  }
  return 0;
}

}  // namespace fbf::ingest
