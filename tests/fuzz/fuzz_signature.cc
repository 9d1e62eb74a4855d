// The whitelist signature coder, both ways. The first byte picks the
// direction: even, the rest is a signature text (as a stored preference
// might hold it) that, when it decodes, must re-encode to the same text;
// odd, the rest is a list of 16-bit application ids whose signature must
// decode back to exactly their bitmap.
#include "fuzz_check.h"
#include "platform/logging.h"
#include "whitelist/signature_decoder.h"
#include "whitelist/whitelist_format.h"

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const bool fromIds = data[0] & 1;
  ++data;
  --size;

  if (!fromIds) {
    std::string text(reinterpret_cast<const char*>(data), size);
    std::string why;
    auto decoded = fbf::testing::decodeSignature(text, &why);
    if (!decoded) return 0;
    std::vector<uint8_t> payload;
    const bool compressed = fbf::rle_compress(decoded->bitmap, payload) == 1;
    FUZZ_CHECK(compressed == decoded->compressed, "the coder chose another coding for the same bitmap");
    char version[8];
    std::snprintf(version, sizeof version, "%04x", decoded->version);
    auto again = fbf::makeSignature(payload, static_cast<uint16_t>(decoded->bitmap.size()), compressed, version);
    FUZZ_CHECK(again == text, "re-encoding changed the signature:\n  %s\n  %s", text.c_str(), again.c_str());
    return 0;
  }

  std::vector<uint64_t> ids;
  for (size_t i = 0; i + 1 < size; i += 2) ids.push_back((uint64_t{data[i]} << 8) | data[i + 1]);
  if (ids.empty()) return 0;
  std::sort(ids.begin(), ids.end());
  ids.erase(std::unique(ids.begin(), ids.end()), ids.end());
  auto text = fbf::signatureForIds(ids, "1.0.7f3e");
  std::string why;
  auto decoded = fbf::testing::decodeSignature(text, &why);
  FUZZ_CHECK(decoded.has_value(), "our own signature does not decode: %s", why.c_str());
  FUZZ_CHECK(decoded->bitmap == fbf::testing::bitmapOf(ids), "the signature carries another bitmap");
  FUZZ_CHECK(decoded->version == 0x7f3e, "version word %x", decoded->version);
  return 0;
}
