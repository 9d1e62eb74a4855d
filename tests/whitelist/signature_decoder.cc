#include "whitelist/signature_decoder.h"

#include <openssl/evp.h>
#include <zlib.h>

#include <algorithm>

namespace fbf::testing {
namespace {

uint32_t be32(const uint8_t* p) {
  return (uint32_t{p[0]} << 24) | (uint32_t{p[1]} << 16) | (uint32_t{p[2]} << 8) | uint32_t{p[3]};
}
uint16_t be16(const uint8_t* p) { return static_cast<uint16_t>((p[0] << 8) | p[1]); }

int base64Value(char c) {
  static const std::string_view kAlphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  auto at = kAlphabet.find(c);
  return at == std::string_view::npos ? -1 : static_cast<int>(at);
}

// Runs of equal bits, each at most 256 long, counted straight from the bits.
size_t canonicalRunCount(const std::vector<uint8_t>& bitmap) {
  size_t runs = 0;
  int previous = -1;
  size_t length = 0;
  for (size_t i = 0; i < bitmap.size() * 8; ++i) {
    int bit = (bitmap[i / 8] >> (7 - i % 8)) & 1;
    if (bit != previous || length == 256) {
      ++runs;
      length = 0;
      previous = bit;
    }
    ++length;
  }
  return runs;
}

std::optional<DecodedSignature> fail(std::string* why, std::string text) {
  if (why) *why = std::move(text);
  return std::nullopt;
}

}  // namespace

std::optional<std::vector<uint8_t>> decodeBase64(std::string_view text) {
  if (text.size() % 4 != 0) return std::nullopt;
  std::vector<uint8_t> out;
  for (size_t i = 0; i < text.size(); i += 4) {
    bool last = i + 4 == text.size();
    int v[4];
    int padding = 0;
    for (int k = 0; k < 4; ++k) {
      char c = text[i + k];
      if (c == '=' && last && k >= 2) {
        v[k] = 0;
        ++padding;
        continue;
      }
      if (padding) return std::nullopt;  // data after padding
      v[k] = base64Value(c);
      if (v[k] < 0) return std::nullopt;
    }
    uint32_t group =
        (uint32_t(v[0]) << 18) | (uint32_t(v[1]) << 12) | (uint32_t(v[2]) << 6) | uint32_t(v[3]);
    out.push_back(static_cast<uint8_t>(group >> 16));
    if (padding < 2) out.push_back(static_cast<uint8_t>(group >> 8));
    if (padding < 1) out.push_back(static_cast<uint8_t>(group));
  }
  return out;
}

std::vector<uint8_t> md5Tail(const std::vector<uint8_t>& bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest, &length, EVP_md5(), nullptr);
  return {digest + 12, digest + 16};
}

std::vector<uint8_t> bitmapOf(const std::vector<uint64_t>& ids) {
  std::vector<uint8_t> bytes(*std::max_element(ids.begin(), ids.end()) / 8 + 1, 0);
  for (auto id : ids) bytes[id / 8] = static_cast<uint8_t>(bytes[id / 8] | (1u << (7 - id % 8)));
  return bytes;
}

std::optional<DecodedSignature> decodeSignature(std::string_view text, std::string* why) {
  auto record = decodeBase64(text);
  if (!record) return fail(why, "not standard base64");
  if (record->size() < 12) return fail(why, "record shorter than its header and digest tail");
  const uint8_t* r = record->data();
  uint32_t crc = static_cast<uint32_t>(crc32(0L, r + 4, static_cast<uInt>(record->size() - 4)));
  if (crc != be32(r)) return fail(why, "CRC mismatch");

  DecodedSignature decoded;
  uint16_t word = be16(r + 4);
  decoded.compressed = (word & 0x8000) != 0;
  decoded.version = word & 0x7FFF;
  size_t bitmapLength = be16(r + 6);
  if (bitmapLength == 0) return fail(why, "empty bitmap");
  std::vector<uint8_t> tail(r + 8, r + 12);
  const uint8_t* body = r + 12;
  size_t bodyLength = record->size() - 12;

  if (!decoded.compressed) {
    if (bodyLength != bitmapLength)
      return fail(why, "stored bitmap length differs from the header");
    decoded.bitmap.assign(body, body + bodyLength);
    size_t runs = canonicalRunCount(decoded.bitmap);
    if (2 + runs + (runs + 7) / 8 < bitmapLength)
      return fail(why, "stored although the run coding is shorter");
  } else {
    if (bodyLength < 2) return fail(why, "no run count");
    size_t runs = be16(body);
    size_t flagBytes = (runs + 7) / 8;
    if (bodyLength != 2 + runs + flagBytes) return fail(why, "run coding length mismatch");
    if (bodyLength >= bitmapLength) return fail(why, "compressed although not shorter");
    const uint8_t* counts = body + 2;
    const uint8_t* flags = counts + runs;
    decoded.bitmap.assign(bitmapLength, 0);
    size_t position = 0;
    for (size_t i = 0; i < runs; ++i) {
      bool ones = (flags[i / 8] & (0x80u >> (i % 8))) != 0;
      if (i > 0) {
        bool previousOnes = (flags[(i - 1) / 8] & (0x80u >> ((i - 1) % 8))) != 0;
        if (previousOnes == ones && counts[i - 1] != 255)
          return fail(why, "run split before 256 bits");
      }
      size_t length = size_t{counts[i]} + 1;
      if (position + length > bitmapLength * 8) return fail(why, "runs overflow the bitmap");
      for (size_t k = position; ones && k < position + length; ++k) {
        decoded.bitmap[k / 8] = static_cast<uint8_t>(decoded.bitmap[k / 8] | (0x80u >> (k % 8)));
      }
      position += length;
    }
    if (runs % 8 != 0 && (flags[flagBytes - 1] & ((1u << (8 - runs % 8)) - 1)) != 0)
      return fail(why, "flag padding not zero");
    if (position != bitmapLength * 8) return fail(why, "runs do not cover the bitmap");
  }
  if (md5Tail(decoded.bitmap) != tail) return fail(why, "digest tail mismatch");
  return decoded;
}

}  // namespace fbf::testing
