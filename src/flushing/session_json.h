// The dictionary form of a protobuf message used in the JSON session upload:
// every set field under its .proto name, in field-number order. Numbers are
// JSON numbers (64-bit integers included: the receiver reads them as numbers,
// not as the strings the stock protobuf JSON printer would write), enums are
// their numbers, booleans are booleans, nested messages are objects, repeated
// fields are arrays, maps are objects keyed by the map key's text, bytes are
// base64 text. "Set" means present for fields with presence and non-default
// for plain proto3 scalars, so zero values are left out.
// Stateless; callable from any thread.
#pragma once

#include <google/protobuf/message.h>
#include <nlohmann/json.hpp>

#include <string>
#include <string_view>

namespace fbf {

nlohmann::ordered_json protobufDictionary(const google::protobuf::Message& message);

// Standard base64 with padding.
std::string base64Encode(std::string_view bytes);

}  // namespace fbf
