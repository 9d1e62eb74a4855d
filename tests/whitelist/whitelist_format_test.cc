#include "whitelist/whitelist_format.h"

#include "support/test_support.h"
#include "whitelist/signature_decoder.h"
#include "whitelist/whitelist_fixtures.h"

#include <gtest/gtest.h>

#include <random>

namespace fbf::testing {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes operator+(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

// Guards against: runs split at the wrong length, or coding chosen when not strictly shorter (random sets rarely tie).
TEST(RunCoder, WorkedExamples) {
  struct Row {
    const char* name;
    Bytes bitmap;
    int compressed;
    Bytes coded;  // after the digest tail
  };
  const Row rows[] = {
      {"257 ones cut at 256", Bytes(32, 0xFF) + Bytes{0x80}, 1, {0x00, 0x03, 255, 0, 6, 0xC0}},
      {"equal length is stored", Bytes(4, 0), 0, Bytes(4, 0)},
      {"one byte shorter is coded", Bytes(5, 0), 1, {0x00, 0x01, 39, 0x00}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    Bytes out;
    EXPECT_EQ(rle_compress(row.bitmap, out), row.compressed);
    EXPECT_EQ(out, md5Tail(row.bitmap) + row.coded);
  }
}

// Guards against: a wrong hex digit value or position, the short-version terminator, or a misplaced compression bit.
TEST(VersionWord, LastFourCharactersAsHexWithTheCompressionBit) {
  struct Row {
    bool compressed;
    const char* version;
    uint16_t word;
    size_t complaints;
  };
  const Row rows[] = {{false, "0a1F", 0x0A1F, 0}, {false, "09af", 0x09AF, 0}, {false, "12345", 0x2345, 0}, {false, "ab", 0x2B00, 1},
                      {false, "", 0x0000, 1},     {false, "00g0", 0x0670, 1},  {true, "0a1F", 0x8A1F, 0},
                      {true, "ab", 0xAB00, 1}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.version);
    LogCapture logs;
    EXPECT_EQ(makeCompressionFlagAndVersion(row.compressed, row.version), row.word);
    EXPECT_EQ(logs.count("whitelist: invalid hex character in version string"), row.complaints);
  }
}

// A random bitmap of `length` bytes of alternating runs, each shorter than
// its kind's scale (1 to 2048 bits): small scales alternate every few bits
// and stay stored, large ones give long or sparse runs that are coded. Its
// last bit is set, so that it is exactly the bitmap of its ids.
Bytes randomBitmap(std::mt19937_64& random, size_t length, uint64_t minimumScale) {
  Bytes bitmap(length, 0);
  uint64_t bits = uint64_t{length} * 8;
  uint64_t scale[2] = {std::max(minimumScale, uint64_t{1} << (random() % 12)),
                       std::max(minimumScale, uint64_t{1} << (random() % 12))};
  for (uint64_t i = 0, ones = random() % 2; i < bits; ones = !ones) {
    for (uint64_t end = std::min(bits, i + 1 + random() % scale[ones]); i < end; ++i) {
      if (ones) bitmap[i / 8] = static_cast<uint8_t>(bitmap[i / 8] | (0x80u >> (i % 8)));
    }
  }
  bitmap.back() |= 1;
  return bitmap;
}

std::vector<uint64_t> idsOf(const Bytes& bitmap) {
  std::vector<uint64_t> ids;
  for (size_t i = 0; i < bitmap.size() * 8; ++i) {
    if (bitmap[i / 8] & (0x80u >> (i % 8))) ids.push_back(i);
  }
  return ids;
}

// Guards against: any coding or framing fault (CRC, header, digest, runs) the independent reader sees, at any size.
TEST(SignatureRoundTrip, RandomIdSetsDecodeToTheirBitmaps) {
  std::mt19937_64 random(20240611);
  constexpr int kSets = 120;
  std::uniform_real_distribution<double> exponent(0.0, std::log2(double(kMaximumBitmapLength)));
  int compressed = 0;
  for (int n = 0; n < kSets; ++n) {
    // Log-uniform sizes, so that tiny and maximal bitmaps both occur.
    auto length = std::clamp<size_t>(static_cast<size_t>(std::exp2(exponent(random))), 1, kMaximumBitmapLength);
    if (n % 40 == 0) length = kMaximumBitmapLength;
    // Bitmaps that may stay uncompressed only where a stored one fits.
    Bytes bitmap = randomBitmap(random, length, length + 4 >= kPayloadLengthLimit ? 64 : 1);
    std::string version = std::to_string(random() % 100000);
    std::string why;
    auto decoded = decodeSignature(signatureForIds(idsOf(bitmap), version), &why);
    ASSERT_TRUE(decoded) << "set " << n << " (" << length << " bytes): " << why;
    ASSERT_EQ(decoded->bitmap, bitmap) << "set " << n;
    ASSERT_EQ(decoded->version, makeCompressionFlagAndVersion(false, version)) << "set " << n;
    compressed += decoded->compressed;
  }
  // Both forms were exercised.
  EXPECT_GT(compressed, kSets / 4);
  EXPECT_LT(compressed, kSets);
}

// Guards against: a bitmap or payload past its 16-bit field written truncated instead of stopping the process.
TEST(SignatureLimitsDeathTest, PastTheRecordLimitsTheProcessStops) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(makeBitmap({kMaximumBitmapLength * 8}), "whitelist bitmap too long");
  std::vector<uint64_t> alternating;
  for (uint64_t i = 0; i < (kPayloadLengthLimit - 4) * 8; i += 2) alternating.push_back(i);
  EXPECT_DEATH(signatureForIds(alternating, "0001"), "whitelist payload too long");
}

// Guards against: wrong applications counted, or a malformed resource taken for one listing no app, or the reverse.
TEST(WhitelistDocuments, WhichApplicationsCountAndWhichDocumentsAreUnusable) {
  FixedRegistry registry;
  registry.apps = {installed("mail"), installed("maps"), installed("tool"),
                   {"unversioned", std::nullopt, false}, {"", std::string("1"), false}};
  using J = nlohmann::json;
  const J good = {{"version", "1"}, {"apps", {{"mail", entry(0)}}}};
  const std::string complete = document(good);
  const auto unusable = WhitelistFailure::unusableFile;
  const auto noneListed = WhitelistFailure::noWhitelistedApplications;
  struct Row {
    const char* name;
    std::string doc;
    std::optional<Bytes> bitmap;
    WhitelistFailure failure = unusable;
    std::set<std::string> disabled = {};
  };
  const Row rows[] = {
      {"installed and whitelisted", whitelistDocument({{"mail", entry(0)}, {"tool", entry(9)}, {"gone", entry(3)}}),
       Bytes{0x80, 0x40}},
      {"only the last entry counts",
       whitelistDocument({{"mail", {{{"encoding_id", 20}}, {{"encoding_id", 1}}}},
                          {"maps", {{{"encoding_id", 5}}, {{"name", "no id"}}}},
                          {"tool", entry(2)}}),
       Bytes{0x60}},
      {"disabled", whitelistDocument({{"mail", entry(0)}, {"tool", entry(9)}, {"maps", entry(1)}}), Bytes{0x80},
       unusable, {"tool", "maps"}},
      {"no version or identifier", whitelistDocument({{"unversioned", entry(0)}, {"", entry(1)}, {"tool", entry(2)}}),
       Bytes{0x20}},
      {"ids not unsigned",
       whitelistDocument({{"mail", {{{"encoding_id", -1}}}}, {"maps", {{{"encoding_id", "4"}}}},
                          {"tool", {{{"encoding_id", 1.5}}}}}),
       std::nullopt, noneListed},
      {"entries not an array of objects",
       whitelistDocument({{"mail", {{"encoding_id", 1}}}, {"maps", J::array()}, {"tool", {5}}}), std::nullopt,
       noneListed},
      {"compression in lower case", document(good, "rle"), std::nullopt},
      {"encoding capitalised", document(good, "RLE", "Bitmap"), std::nullopt},
      {"no encoding", J{{"apps", good.dump()}, {"compression", "RLE"}}.dump(), std::nullopt},
      {"apps not a string", J{{"apps", good}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump(), std::nullopt},
      {"truncated", complete.substr(0, complete.size() / 2), std::nullopt},
      {"outer an array", "[]", std::nullopt},
      {"inner not json", J{{"apps", "{not json"}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump(), std::nullopt},
      {"inner an array", document(J::array()), std::nullopt},
      {"no version", document({{"apps", {{"mail", entry(0)}}}}), std::nullopt},
      {"version not a string", document({{"version", 7}, {"apps", {{"mail", entry(0)}}}}), std::nullopt},
      {"apps an array", document({{"version", "1"}, {"apps", J::array()}}), std::nullopt},
      {"complete", complete, Bytes{0x80}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    WhitelistFailure failure = row.failure == unusable ? noneListed : unusable;
    auto signature = processWhitelist(row.doc, row.disabled, registry, &failure);
    if (!row.bitmap) {
      EXPECT_EQ(signature, std::nullopt);
      EXPECT_EQ(failure, row.failure);
      continue;
    }
    ASSERT_TRUE(signature);
    std::string why;
    auto decoded = decodeSignature(*signature, &why);
    ASSERT_TRUE(decoded) << why;
    EXPECT_EQ(decoded->bitmap, *row.bitmap);
  }
}

}  // namespace
}  // namespace fbf::testing
