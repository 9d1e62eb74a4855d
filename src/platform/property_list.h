// Property lists (XML or binary) as JSON values.
//
// Preferences and the configuration bag are property lists. In memory they are
// nlohmann::json values: booleans, integers, reals, strings, arrays and
// dictionaries map one to one; data becomes a JSON binary value and a date the
// number of seconds since 1970.
#pragma once

#include <nlohmann/json.hpp>

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

namespace fbf {

using PropertyList = nlohmann::json;

// Parses XML or binary property-list bytes. No value, with `error` set, when
// the bytes are not a property list.
std::optional<PropertyList> parsePropertyList(std::string_view bytes, std::string* error = nullptr);

enum class PropertyListFormat { xml, binary };
std::string serializePropertyList(const PropertyList& value, PropertyListFormat format);

}  // namespace fbf
