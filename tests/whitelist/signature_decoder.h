// An independent reader of whitelist signatures: base64, CRC-32, version
// word, the stored or run-coded bitmap and its MD5 tail. It accepts only
// canonical codings (maximal runs, zero padding, compression only when
// strictly shorter), so a coder that drifts from the format fails the tests.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace fbf::testing {

struct DecodedSignature {
  bool compressed = false;
  uint16_t version = 0;  // bits 14-0 of the flag-and-version word
  std::vector<uint8_t> bitmap;
};

// Standard base64 without line breaks; no value on any other character.
std::optional<std::vector<uint8_t>> decodeBase64(std::string_view text);

// No value, with `why` set, when anything about the record is inconsistent.
std::optional<DecodedSignature> decodeSignature(std::string_view text, std::string* why);

// The bitmap for a set of ids, built bit by bit.
std::vector<uint8_t> bitmapOf(const std::vector<uint64_t>& ids);

// Bytes 12-15 of the MD5 digest.
std::vector<uint8_t> md5Tail(const std::vector<uint8_t>& bytes);

}  // namespace fbf::testing
