#include "flushing/session_json.h"

#include <map>
#include <vector>

namespace fbf {

using google::protobuf::FieldDescriptor;
using google::protobuf::Message;
using google::protobuf::Reflection;
using nlohmann::ordered_json;

std::string base64Encode(std::string_view bytes) {
  static constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string out;
  out.reserve((bytes.size() + 2) / 3 * 4);
  size_t i = 0;
  for (; i + 2 < bytes.size(); i += 3) {
    uint32_t v = (uint32_t(uint8_t(bytes[i])) << 16) | (uint32_t(uint8_t(bytes[i + 1])) << 8) | uint8_t(bytes[i + 2]);
    out += kAlphabet[(v >> 18) & 63];
    out += kAlphabet[(v >> 12) & 63];
    out += kAlphabet[(v >> 6) & 63];
    out += kAlphabet[v & 63];
  }
  if (size_t rest = bytes.size() - i; rest > 0) {
    uint32_t v = uint32_t(uint8_t(bytes[i])) << 16;
    if (rest == 2) v |= uint32_t(uint8_t(bytes[i + 1])) << 8;
    out += kAlphabet[(v >> 18) & 63];
    out += kAlphabet[(v >> 12) & 63];
    out += rest == 2 ? kAlphabet[(v >> 6) & 63] : '=';
    out += '=';
  }
  return out;
}

namespace {

ordered_json singleValue(const Message& m, const Reflection& r, const FieldDescriptor* f) {
  switch (f->cpp_type()) {
    case FieldDescriptor::CPPTYPE_INT32: return r.GetInt32(m, f);
    case FieldDescriptor::CPPTYPE_INT64: return r.GetInt64(m, f);
    case FieldDescriptor::CPPTYPE_UINT32: return r.GetUInt32(m, f);
    case FieldDescriptor::CPPTYPE_UINT64: return r.GetUInt64(m, f);
    case FieldDescriptor::CPPTYPE_DOUBLE: return r.GetDouble(m, f);
    case FieldDescriptor::CPPTYPE_FLOAT: return r.GetFloat(m, f);
    case FieldDescriptor::CPPTYPE_BOOL: return r.GetBool(m, f);
    case FieldDescriptor::CPPTYPE_ENUM: return r.GetEnumValue(m, f);
    case FieldDescriptor::CPPTYPE_STRING:
      if (f->type() == FieldDescriptor::TYPE_BYTES) return base64Encode(r.GetString(m, f));
      return r.GetString(m, f);
    case FieldDescriptor::CPPTYPE_MESSAGE: return protobufDictionary(r.GetMessage(m, f));
  }
  return nullptr;
}

ordered_json repeatedValue(const Message& m, const Reflection& r, const FieldDescriptor* f, int i) {
  switch (f->cpp_type()) {
    case FieldDescriptor::CPPTYPE_INT32: return r.GetRepeatedInt32(m, f, i);
    case FieldDescriptor::CPPTYPE_INT64: return r.GetRepeatedInt64(m, f, i);
    case FieldDescriptor::CPPTYPE_UINT32: return r.GetRepeatedUInt32(m, f, i);
    case FieldDescriptor::CPPTYPE_UINT64: return r.GetRepeatedUInt64(m, f, i);
    case FieldDescriptor::CPPTYPE_DOUBLE: return r.GetRepeatedDouble(m, f, i);
    case FieldDescriptor::CPPTYPE_FLOAT: return r.GetRepeatedFloat(m, f, i);
    case FieldDescriptor::CPPTYPE_BOOL: return r.GetRepeatedBool(m, f, i);
    case FieldDescriptor::CPPTYPE_ENUM: return r.GetRepeatedEnumValue(m, f, i);
    case FieldDescriptor::CPPTYPE_STRING:
      if (f->type() == FieldDescriptor::TYPE_BYTES) return base64Encode(r.GetRepeatedString(m, f, i));
      return r.GetRepeatedString(m, f, i);
    case FieldDescriptor::CPPTYPE_MESSAGE: return protobufDictionary(r.GetRepeatedMessage(m, f, i));
  }
  return nullptr;
}

// A map key as object key text: strings as they are, numbers and booleans in
// their decimal / literal form.
std::string mapKeyText(const ordered_json& key) {
  return key.is_string() ? key.get<std::string>() : key.dump();
}

}  // namespace

ordered_json protobufDictionary(const Message& message) {
  ordered_json out = ordered_json::object();
  const Reflection& r = *message.GetReflection();
  std::vector<const FieldDescriptor*> fields;
  r.ListFields(message, &fields);
  for (const FieldDescriptor* f : fields) {
    if (f->is_map()) {
      // Sorted by key: the map's own iteration order is unspecified.
      std::map<std::string, ordered_json> sorted;
      const FieldDescriptor* keyField = f->message_type()->map_key();
      const FieldDescriptor* valueField = f->message_type()->map_value();
      for (int i = 0, n = r.FieldSize(message, f); i < n; ++i) {
        const Message& entry = r.GetRepeatedMessage(message, f, i);
        const Reflection& er = *entry.GetReflection();
        sorted[mapKeyText(singleValue(entry, er, keyField))] = singleValue(entry, er, valueField);
      }
      ordered_json object = ordered_json::object();
      for (auto& [key, value] : sorted) object[key] = std::move(value);
      out[f->name()] = std::move(object);
    } else if (f->is_repeated()) {
      ordered_json array = ordered_json::array();
      for (int i = 0, n = r.FieldSize(message, f); i < n; ++i) array.push_back(repeatedValue(message, r, f, i));
      out[f->name()] = std::move(array);
    } else {
      out[f->name()] = singleValue(message, r, f);
    }
  }
  return out;
}

}  // namespace fbf
