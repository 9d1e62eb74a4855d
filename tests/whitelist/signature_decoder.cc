#include "whitelist/signature_decoder.h"

#include <openssl/evp.h>
#include <zlib.h>

#include <algorithm>

namespace fbf::testing {
namespace {

using Bytes = std::vector<uint8_t>;

bool bitAt(const Bytes& bitmap, size_t i) { return (bitmap[i / 8] >> (7 - i % 8)) & 1; }
void setBit(Bytes& bitmap, size_t i) { bitmap[i / 8] = static_cast<uint8_t>(bitmap[i / 8] | (0x80u >> (i % 8))); }
void put16(Bytes& out, size_t value) {
  out.push_back(static_cast<uint8_t>(value >> 8));
  out.push_back(static_cast<uint8_t>(value));
}

// The one record a correct coder writes for a bitmap: maximal runs of at
// most 256 equal bits, run-coded only when that is strictly shorter.
Bytes canonicalRecord(const Bytes& bitmap, uint16_t version) {
  Bytes counts, flags;
  for (size_t i = 0, bits = bitmap.size() * 8; i < bits;) {
    size_t start = i;
    while (i < bits && i - start < 256 && bitAt(bitmap, i) == bitAt(bitmap, start)) ++i;
    if (counts.size() % 8 == 0) flags.push_back(0);
    if (bitAt(bitmap, start)) flags.back() = static_cast<uint8_t>(flags.back() | (0x80u >> (counts.size() % 8)));
    counts.push_back(static_cast<uint8_t>(i - start - 1));
  }
  bool compressed = 2 + counts.size() + flags.size() < bitmap.size();
  Bytes record(4, 0);
  put16(record, version | (compressed ? 0x8000u : 0u));
  put16(record, bitmap.size());
  auto tail = md5Tail(bitmap);
  record.insert(record.end(), tail.begin(), tail.end());
  if (!compressed) {
    record.insert(record.end(), bitmap.begin(), bitmap.end());
  } else {
    put16(record, counts.size());
    record.insert(record.end(), counts.begin(), counts.end());
    record.insert(record.end(), flags.begin(), flags.end());
  }
  auto crc = static_cast<uint32_t>(crc32(0L, record.data() + 4, static_cast<uInt>(record.size() - 4)));
  for (int k = 0; k < 4; ++k) record[k] = static_cast<uint8_t>(crc >> (24 - 8 * k));
  return record;
}

std::optional<DecodedSignature> fail(std::string* why, std::string text) {
  if (why) *why = std::move(text);
  return std::nullopt;
}

}  // namespace

std::optional<std::vector<uint8_t>> decodeBase64(std::string_view text) {
  Bytes out(text.size() / 4 * 3 + 3);
  int n = EVP_DecodeBlock(out.data(), reinterpret_cast<const unsigned char*>(text.data()),
                          static_cast<int>(text.size()));
  size_t padding = text.ends_with("==") ? 2 : text.ends_with('=') ? 1 : 0;
  if (n < 0 || static_cast<size_t>(n) < padding) return std::nullopt;
  out.resize(static_cast<size_t>(n) - padding);
  // Only the canonical spelling: no whitespace, no stray bits in the padding.
  std::string again(out.size() / 3 * 4 + 5, '\0');
  again.resize(static_cast<size_t>(EVP_EncodeBlock(reinterpret_cast<unsigned char*>(again.data()), out.data(),
                                                   static_cast<int>(out.size()))));
  if (again != text) return std::nullopt;
  return out;
}

std::vector<uint8_t> md5Tail(const std::vector<uint8_t>& bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest, &length, EVP_md5(), nullptr);
  return {digest + 12, digest + 16};
}

std::vector<uint8_t> bitmapOf(const std::vector<uint64_t>& ids) {
  Bytes bitmap(*std::max_element(ids.begin(), ids.end()) / 8 + 1, 0);
  for (auto id : ids) setBit(bitmap, id);
  return bitmap;
}

// Reads the bitmap leniently, then accepts the record only if it is exactly
// the canonical record of that bitmap (CRC, header, digest tail and coding).
std::optional<DecodedSignature> decodeSignature(std::string_view text, std::string* why) {
  auto record = decodeBase64(text);
  if (!record || record->size() < 12) return fail(why, "not base64 of a record with its header");
  const Bytes& r = *record;
  DecodedSignature decoded;
  decoded.compressed = (r[4] & 0x80) != 0;
  decoded.version = static_cast<uint16_t>(((r[4] & 0x7F) << 8) | r[5]);
  size_t bits = size_t((r[6] << 8) | r[7]) * 8;
  if (!decoded.compressed) {
    decoded.bitmap.assign(r.begin() + 12, r.end());
  } else {
    size_t runs = r.size() >= 14 ? size_t((r[12] << 8) | r[13]) : 0;
    if (runs == 0 || r.size() < 14 + runs + (runs + 7) / 8) return fail(why, "run coding cut short");
    decoded.bitmap.assign(bits / 8, 0);
    for (size_t i = 0, at = 0; i < runs && at < bits; ++i) {
      bool ones = r[14 + runs + i / 8] & (0x80u >> (i % 8));
      for (size_t end = at + r[14 + i] + 1; at < end && at < bits; ++at) {
        if (ones) setBit(decoded.bitmap, at);
      }
    }
  }
  if (decoded.bitmap.empty()) return fail(why, "empty bitmap");
  if (canonicalRecord(decoded.bitmap, decoded.version) != r) {
    return fail(why, "not the canonical record of its bitmap");
  }
  return decoded;
}

}  // namespace fbf::testing
