#include "platform/property_list.h"

#include <plist/plist.h>

#include <cstdlib>
#include <memory>
#include <stdexcept>
#include <string_view>

namespace fbf {
namespace {

// Dates in property lists count from 2001-01-01.
constexpr double kReferenceDateOffset = 978307200.0;

struct PlistFree {
  void operator()(plist_t p) const { plist_free(p); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

// Strict UTF-8: no overlong forms, surrogates or code points past U+10FFFF.
// The binary format's ASCII strings can carry any byte, and such text could
// be neither written back nor shown as JSON.
bool isValidUtf8(std::string_view s) {
  size_t i = 0;
  while (i < s.size()) {
    auto c = static_cast<unsigned char>(s[i]);
    if (c < 0x80) {
      ++i;
      continue;
    }
    size_t extra;
    uint32_t cp;
    if (c >= 0xC2 && c <= 0xDF) {
      extra = 1, cp = c & 0x1F;
    } else if (c >= 0xE0 && c <= 0xEF) {
      extra = 2, cp = c & 0x0F;
    } else if (c >= 0xF0 && c <= 0xF4) {
      extra = 3, cp = c & 0x07;
    } else {
      return false;
    }
    if (i + extra >= s.size()) return false;  // cut short
    for (size_t k = 1; k <= extra; ++k) {
      auto d = static_cast<unsigned char>(s[i + k]);
      if ((d & 0xC0) != 0x80) return false;
      cp = (cp << 6) | (d & 0x3F);
    }
    if ((extra == 2 && (cp < 0x800 || (cp >= 0xD800 && cp <= 0xDFFF))) || (extra == 3 && (cp < 0x10000 || cp > 0x10FFFF)))
      return false;
    i += extra + 1;
  }
  return true;
}

// libplist asserts (aborting the process) when it is asked for a string or
// key whose UTF-16 form in a binary list holds a NUL character, and a key
// cannot be read any other way. So such lists are refused before they are
// parsed: each object of the offset table that is a UTF-16 string is
// checked. Anything malformed here is left to the library to reject.
bool binaryListHasNulCharacter(std::string_view b) {
  if (b.size() < 8 + 32 || b.substr(0, 8) != "bplist00") return false;
  auto be = [&](size_t at, size_t width, uint64_t& out) {
    if (width == 0 || width > 8 || at > b.size() || b.size() - at < width) return false;
    out = 0;
    for (size_t k = 0; k < width; ++k) out = (out << 8) | static_cast<unsigned char>(b[at + k]);
    return true;
  };
  const size_t trailer = b.size() - 32;
  const size_t offsetSize = static_cast<unsigned char>(b[trailer + 6]);
  uint64_t objects = 0, table = 0;
  if (!be(trailer + 8, 8, objects) || !be(trailer + 24, 8, table)) return false;
  if (offsetSize == 0 || offsetSize > 8 || table > trailer || objects > (trailer - table) / offsetSize) return false;
  for (uint64_t i = 0; i < objects; ++i) {
    uint64_t at = 0;
    if (!be(static_cast<size_t>(table + i * offsetSize), offsetSize, at) || at >= trailer) continue;
    const auto marker = static_cast<unsigned char>(b[at]);
    if ((marker >> 4) != 0x6) continue;
    uint64_t units = marker & 0x0F;
    size_t start = static_cast<size_t>(at) + 1;
    if (units == 0x0F) {
      // The length follows as an integer object: marker 0x1N, 2^N bytes.
      if (start >= trailer) continue;
      const auto intMarker = static_cast<unsigned char>(b[start]);
      if ((intMarker >> 4) != 0x1 || (intMarker & 0x0F) > 3) continue;
      const size_t width = size_t{1} << (intMarker & 0x0F);
      if (!be(start + 1, width, units)) continue;
      start += 1 + width;
    }
    for (uint64_t u = 0; u < units && start + 2 * u + 1 < trailer; ++u) {
      if (b[start + 2 * u] == 0 && b[start + 2 * u + 1] == 0) return true;
    }
  }
  return false;
}

std::string checkedText(std::string text) {
  if (!isValidUtf8(text)) throw std::runtime_error("property list holds a string that is not UTF-8");
  return text;
}

// Takes a string the library allocated.
std::string checkedText(char* s) {
  std::string out = s ? s : "";
  std::free(s);
  return checkedText(std::move(out));
}

PropertyList toJson(plist_t node, int depth) {
  if (depth > 64) throw std::runtime_error("property list nested too deeply");
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return b != 0;
    }
    case PLIST_UINT: {
      uint64_t v = 0;
      plist_get_uint_val(node, &v);
      // The library stores every integer in 64 unsigned bits; negative
      // values come back in two's complement.
      return static_cast<int64_t>(v);
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return d;
    }
    case PLIST_STRING: {
      // Not plist_get_string_val: it asserts (aborting the process) when a
      // binary list's string holds a NUL byte.
      uint64_t length = 0;
      const char* s = plist_get_string_ptr(node, &length);
      std::string out = s ? std::string(s, static_cast<size_t>(length)) : std::string();
      if (out.find('\0') != std::string::npos) throw std::runtime_error("property list holds a string with a NUL byte");
      return checkedText(std::move(out));
    }
    case PLIST_KEY: {
      char* s = nullptr;
      plist_get_key_val(node, &s);
      return checkedText(s);
    }
    case PLIST_DATA: {
      char* d = nullptr;
      uint64_t len = 0;
      plist_get_data_val(node, &d, &len);
      std::vector<uint8_t> bytes(d, d + len);
      std::free(d);
      return PropertyList::binary(std::move(bytes));
    }
    case PLIST_DATE: {
      int32_t sec = 0, usec = 0;
      plist_get_date_val(node, &sec, &usec);
      return kReferenceDateOffset + sec + usec / 1e6;
    }
    case PLIST_UID: {
      uint64_t v = 0;
      plist_get_uid_val(node, &v);
      return v;
    }
    case PLIST_ARRAY: {
      auto arr = PropertyList::array();
      uint32_t n = plist_array_get_size(node);
      for (uint32_t i = 0; i < n; ++i) arr.push_back(toJson(plist_array_get_item(node, i), depth + 1));
      return arr;
    }
    case PLIST_DICT: {
      auto obj = PropertyList::object();
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      std::unique_ptr<void, decltype(&std::free)> iterGuard(it, &std::free);
      while (true) {
        char* key = nullptr;
        plist_t val = nullptr;
        plist_dict_next_item(node, it, &key, &val);
        if (!val) {
          std::free(key);
          break;
        }
        std::string name = checkedText(key);  // frees the key
        obj[name] = toJson(val, depth + 1);
      }
      return obj;
    }
    default:
      return nullptr;
  }
}

plist_t fromJson(const PropertyList& v) {
  switch (v.type()) {
    case PropertyList::value_t::boolean:
      return plist_new_bool(v.get<bool>() ? 1 : 0);
    case PropertyList::value_t::number_integer:
      return plist_new_uint(static_cast<uint64_t>(v.get<int64_t>()));
    case PropertyList::value_t::number_unsigned:
      return plist_new_uint(v.get<uint64_t>());
    case PropertyList::value_t::number_float:
      return plist_new_real(v.get<double>());
    case PropertyList::value_t::string:
      return plist_new_string(v.get_ref<const std::string&>().c_str());
    case PropertyList::value_t::binary: {
      const auto& b = v.get_binary();
      return plist_new_data(reinterpret_cast<const char*>(b.data()), b.size());
    }
    case PropertyList::value_t::array: {
      plist_t arr = plist_new_array();
      for (const auto& item : v) plist_array_append_item(arr, fromJson(item));
      return arr;
    }
    case PropertyList::value_t::object: {
      plist_t dict = plist_new_dict();
      for (auto it = v.begin(); it != v.end(); ++it) plist_dict_set_item(dict, it.key().c_str(), fromJson(*it));
      return dict;
    }
    default:
      return plist_new_string("");
  }
}

}  // namespace

std::optional<PropertyList> parsePropertyList(std::string_view bytes, std::string* error) {
  if (bytes.empty() || bytes.size() > UINT32_MAX) {
    if (error) *error = bytes.empty() ? "empty file" : "file too large";
    return std::nullopt;
  }
  if (binaryListHasNulCharacter(bytes)) {
    if (error) *error = "property list holds a string with a NUL character";
    return std::nullopt;
  }
  plist_t root = nullptr;
  plist_from_memory(bytes.data(), static_cast<uint32_t>(bytes.size()), &root);
  if (!root) {
    if (error) *error = "not a property list";
    return std::nullopt;
  }
  PlistPtr guard(root);
  try {
    return toJson(root, 0);
  } catch (const std::exception& e) {
    if (error) *error = e.what();
    return std::nullopt;
  }
}

std::string serializePropertyList(const PropertyList& value, PropertyListFormat format) {
  PlistPtr root(fromJson(value));
  char* out = nullptr;
  uint32_t len = 0;
  if (format == PropertyListFormat::xml) {
    plist_to_xml(root.get(), &out, &len);
  } else {
    plist_to_bin(root.get(), &out, &len);
  }
  std::string s(out ? out : "", len);
  if (format == PropertyListFormat::xml) plist_to_xml_free(out); else plist_to_bin_free(out);
  return s;
}

}  // namespace fbf
