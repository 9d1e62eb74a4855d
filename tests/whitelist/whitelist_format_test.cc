#include "whitelist/whitelist_format.h"

#include "support/test_support.h"
#include "whitelist/signature_decoder.h"

#include <gtest/gtest.h>
#include <zlib.h>

#include <fcntl.h>
#include <unistd.h>

#include <random>

namespace fbf {
namespace {

using testing::decodeBase64;
using testing::decodeSignature;
using testing::md5Tail;

class FixedRegistry final : public ApplicationRegistry {
 public:
  explicit FixedRegistry(std::vector<InstalledApplication> apps) : apps_(std::move(apps)) {}
  std::vector<InstalledApplication> installedApplications() const override { return apps_; }

 private:
  std::vector<InstalledApplication> apps_;
};

InstalledApplication app(std::string id) { return {std::move(id), std::string("1.0"), false}; }

std::vector<uint8_t> bytes(std::initializer_list<int> values) {
  std::vector<uint8_t> out;
  for (int v : values) out.push_back(static_cast<uint8_t>(v));
  return out;
}

// ---- the run coder on the worked examples ----

TEST(RunCoderWorkedExamples, NinetyNineZeroBytesThenOneBit) {
  std::vector<uint8_t> bitmap(99, 0);
  bitmap.push_back(0x80);

  BitRuns runs = collectRuns(bitmap);
  EXPECT_EQ(runs.counts, bytes({255, 255, 255, 23, 0, 6}));
  EXPECT_EQ(runs.flags, bytes({0x08}));

  std::vector<uint8_t> out;
  ASSERT_EQ(rle_compress(bitmap, out), 1);
  ASSERT_EQ(out.size(), 4u + 9u);
  EXPECT_EQ(std::vector<uint8_t>(out.begin(), out.begin() + 4), md5Tail(bitmap));
  EXPECT_EQ(std::vector<uint8_t>(out.begin() + 4, out.end()),
            bytes({0x00, 0x06, 255, 255, 255, 23, 0, 6, 0x08}));
}

TEST(RunCoderWorkedExamples, SixHundredZeroBitsMakeThreeRuns) {
  std::vector<uint8_t> bitmap(75, 0);
  BitRuns runs = collectRuns(bitmap);
  EXPECT_EQ(runs.counts, bytes({255, 255, 87}));
  EXPECT_EQ(runs.flags, bytes({0x00}));
}

TEST(RunCoderWorkedExamples, AlternatingBitsAreStoredRaw) {
  std::vector<uint8_t> bitmap(40, 0xAA);
  std::vector<uint8_t> out;
  ASSERT_EQ(rle_compress(bitmap, out), 0);
  EXPECT_EQ(std::vector<uint8_t>(out.begin() + 4, out.end()), bitmap);

  std::string signature = makeSignature(out, 40, false, "0001");
  auto record = decodeBase64(signature);
  ASSERT_TRUE(record);
  EXPECT_EQ((*record)[4] & 0x80, 0);
}

TEST(RunCoderWorkedExamples, IdsZeroAndNineMakeTwoBytes) {
  EXPECT_EQ(makeBitmap({0, 9}), bytes({0x80, 0x40}));
}

TEST(RunCoderWorkedExamples, A257BitRunOfOnesIsCutAt256) {
  std::vector<uint8_t> bitmap(32, 0xFF);
  bitmap.push_back(0x80);
  BitRuns runs = collectRuns(bitmap);
  EXPECT_EQ(runs.counts, bytes({255, 0, 6}));
  EXPECT_EQ(runs.flags, bytes({0xC0}));
}

TEST(RunCoderWorkedExamples, EqualLengthCodingIsNotUsed) {
  // Four zero bytes: one run, so 2 + 1 + 1 = 4 coded bytes, no saving.
  std::vector<uint8_t> out;
  EXPECT_EQ(encodeRun(std::vector<uint8_t>(4, 0), out), 0);
  EXPECT_EQ(out, std::vector<uint8_t>(4, 0));
  // Five zero bytes: the same 4 coded bytes are shorter.
  out.clear();
  EXPECT_EQ(encodeRun(std::vector<uint8_t>(5, 0), out), 1);
  EXPECT_EQ(out, bytes({0x00, 0x01, 39, 0x00}));
}

TEST(RunCoderWorkedExamples, NineRunsFillASecondFlagByte) {
  // Nine one-bit runs alternating, then one long run of zeros: ten flags.
  std::vector<uint8_t> bitmap = {0xAA, 0x80, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
  BitRuns runs = collectRuns(bitmap);
  ASSERT_EQ(runs.counts.size(), 10u);
  EXPECT_EQ(runs.flags, bytes({0xAA, 0x80}));
}

// ---- the version word ----

class VersionWord : public ::testing::Test {
 protected:
  testing::LogCapture logs;
  static constexpr const char* kComplaint = "whitelist: invalid hex character in version string";
};

TEST_F(VersionWord, FourHexDigitsInAnyCase) {
  EXPECT_EQ(makeCompressionFlagAndVersion(false, "0a1F"), 0x0A1F);
  EXPECT_EQ(logs.count(kComplaint), 0u);
}

TEST_F(VersionWord, OnlyTheLastFourCharactersCount) {
  EXPECT_EQ(makeCompressionFlagAndVersion(false, "12345"), 0x2345);
}

TEST_F(VersionWord, ShortVersionReadsItsTerminatorAndLosesTheTopBit) {
  EXPECT_EQ(makeCompressionFlagAndVersion(false, "ab"), 0x2B00);
  EXPECT_EQ(logs.count(kComplaint), 1u);
}

TEST_F(VersionWord, EmptyVersionIsZeroAfterOneComplaint) {
  EXPECT_EQ(makeCompressionFlagAndVersion(false, ""), 0x0000);
  EXPECT_EQ(logs.count(kComplaint), 1u);
}

TEST_F(VersionWord, NonHexCharactersKeepTheirRawByte) {
  // 'g' is 0x67, in the third position: 0x67 << 4.
  EXPECT_EQ(makeCompressionFlagAndVersion(false, "00g0"), 0x0670);
  EXPECT_EQ(logs.count(kComplaint), 1u);
}

TEST_F(VersionWord, CompressionSetsBitFifteen) {
  EXPECT_EQ(makeCompressionFlagAndVersion(true, "0a1F"), 0x8A1F);
  EXPECT_EQ(makeCompressionFlagAndVersion(true, "ab"), 0xAB00);
}

// ---- the record ----

TEST(SignatureRecord, IdsZeroAndNineWithTheirFrame) {
  std::string signature = signatureForIds({0, 9}, "0a1F");
  EXPECT_EQ(signature.find_first_not_of(
                "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/="),
            std::string::npos);
  auto record = decodeBase64(signature);
  ASSERT_TRUE(record);
  ASSERT_EQ(record->size(), 8u + 4u + 2u);
  const auto& r = *record;
  uint32_t crc = static_cast<uint32_t>(crc32(0L, r.data() + 4, static_cast<uInt>(r.size() - 4)));
  EXPECT_EQ(
      std::vector<uint8_t>(r.begin(), r.begin() + 4),
      bytes({int(crc >> 24), int((crc >> 16) & 0xFF), int((crc >> 8) & 0xFF), int(crc & 0xFF)}));
  EXPECT_EQ(std::vector<uint8_t>(r.begin() + 4, r.begin() + 8), bytes({0x0A, 0x1F, 0x00, 0x02}));
  EXPECT_EQ(std::vector<uint8_t>(r.begin() + 8, r.begin() + 12), md5Tail(bytes({0x80, 0x40})));
  EXPECT_EQ(std::vector<uint8_t>(r.begin() + 12, r.end()), bytes({0x80, 0x40}));
}

TEST(SignatureRecord, LongSignaturesHaveNoLineBreaks) {
  std::vector<uint64_t> ids;
  for (uint64_t i = 0; i < 4000; i += 3) ids.push_back(i);
  std::string signature = signatureForIds(ids, "0001");
  EXPECT_GT(signature.size(), 76u);
  EXPECT_EQ(signature.find('\n'), std::string::npos);
  std::string why;
  EXPECT_TRUE(decodeSignature(signature, &why)) << why;
}

// A random bitmap of `length` bytes in one of four shapes: sparse ids, dense
// noise, long blocks, short alternations. Its last bit is set, so that it is
// exactly the bitmap of its ids.
std::vector<uint8_t> randomBitmap(std::mt19937_64& random, size_t length, int shape) {
  std::vector<uint8_t> bitmap(length, 0);
  uint64_t bits = uint64_t{length} * 8;
  auto set = [&bitmap](uint64_t i) {
    bitmap[i / 8] = static_cast<uint8_t>(bitmap[i / 8] | (0x80u >> (i % 8)));
  };
  switch (shape) {
    case 0: {
      size_t count = 1 + random() % 200;
      for (size_t i = 0; i < count; ++i) set(random() % bits);
      break;
    }
    case 1: {
      int density = static_cast<int>(random() % 3);
      for (auto& byte : bitmap) {
        uint64_t a = random(), b = random();
        byte = static_cast<uint8_t>(density == 0 ? (a & b) : density == 1 ? a : (a | b));
      }
      break;
    }
    case 2: {
      bool ones = random() % 2;
      for (uint64_t i = 0; i < bits;) {
        uint64_t block = 1 + random() % 700;
        if (ones) {
          for (uint64_t k = i; k < std::min(bits, i + block); ++k) set(k);
        }
        i += block;
        ones = !ones;
      }
      break;
    }
    default: {
      static constexpr uint8_t kPatterns[] = {0xAA, 0x55, 0xCC, 0x33, 0xF0, 0x0F, 0x99};
      for (auto& byte : bitmap) byte = kPatterns[random() % std::size(kPatterns)];
      break;
    }
  }
  set(bits - 1);
  return bitmap;
}

std::vector<uint64_t> idsOf(const std::vector<uint8_t>& bitmap) {
  std::vector<uint64_t> ids;
  size_t count = 0;
  for (uint8_t byte : bitmap) count += static_cast<size_t>(__builtin_popcount(byte));
  ids.reserve(count);
  for (size_t byte = 0; byte < bitmap.size(); ++byte) {
    if (!bitmap[byte]) continue;
    for (unsigned bit = 0; bit < 8; ++bit) {
      if (bitmap[byte] & (0x80u >> bit)) ids.push_back(byte * 8 + bit);
    }
  }
  return ids;
}

// Random id sets, from one id to the largest bitmap the record allows, read
// back by the independent decoder.
TEST(SignatureRoundTrip, RandomIdSetsDecodeToTheirBitmaps) {
  std::mt19937_64 random(20240611);
  constexpr int kSets = 2000;
  std::uniform_real_distribution<double> exponent(0.0, std::log2(double(kMaximumBitmapLength)));
  int compressed = 0;
  for (int n = 0; n < kSets; ++n) {
    // Log-uniform sizes, so that tiny and maximal bitmaps both occur.
    size_t length = std::clamp<size_t>(static_cast<size_t>(std::exp2(exponent(random))), 1,
                                       kMaximumBitmapLength);
    if (n % 100 == 0) length = kMaximumBitmapLength;
    int shape = n % 4;
    // Bitmaps that may stay uncompressed only where a stored one fits.
    if (length + 4 >= kPayloadLengthLimit) shape = n % 2 == 0 ? 0 : 2;
    std::vector<uint8_t> bitmap = randomBitmap(random, length, shape);

    std::string version = std::to_string(random() % 100000);
    std::string signature = signatureForIds(idsOf(bitmap), version);
    std::string why;
    auto decoded = decodeSignature(signature, &why);
    ASSERT_TRUE(decoded) << "set " << n << " (" << length << " bytes, shape " << shape
                         << "): " << why;
    ASSERT_EQ(decoded->bitmap, bitmap) << "set " << n;
    ASSERT_EQ(decoded->version, makeCompressionFlagAndVersion(false, version)) << "set " << n;
    compressed += decoded->compressed;
  }
  // Both forms were exercised.
  EXPECT_GT(compressed, kSets / 4);
  EXPECT_LT(compressed, kSets);
}

TEST(SignatureRoundTrip, LargestBitmapWithItsFirstAndLastId) {
  uint64_t last = kMaximumBitmapLength * 8 - 1;
  std::string why;
  auto decoded = decodeSignature(signatureForIds({0, last}, "ffff"), &why);
  ASSERT_TRUE(decoded) << why;
  EXPECT_TRUE(decoded->compressed);
  EXPECT_EQ(decoded->bitmap.size(), kMaximumBitmapLength);
  EXPECT_EQ(decoded->bitmap, testing::bitmapOf({0, last}));
}

using SignatureLimitsDeathTest = ::testing::Test;

TEST_F(SignatureLimitsDeathTest, BitmapBeyondSixteenBitsStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(makeBitmap({kMaximumBitmapLength * 8}), "whitelist bitmap too long");
}

TEST_F(SignatureLimitsDeathTest, StoredBitmapTooLongForTheRecordStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  std::vector<uint64_t> alternating;
  for (uint64_t i = 0; i < (kPayloadLengthLimit - 4) * 8; i += 2) alternating.push_back(i);
  EXPECT_DEATH(signatureForIds(alternating, "0001"), "whitelist payload too long");
}

// ---- reading the whitelist document ----

std::string document(const nlohmann::json& inner, std::string compression = "RLE",
                     std::string encoding = "bitmap") {
  return nlohmann::json{
      {"apps", inner.dump()}, {"compression", compression}, {"encoding", encoding}}
      .dump();
}

nlohmann::json innerWith(nlohmann::json apps, std::string version = "0a1F") {
  return {{"version", version}, {"apps", std::move(apps)}};
}

class WhitelistDocuments : public ::testing::Test {
 protected:
  std::optional<std::vector<uint8_t>> bitmapFor(const std::string& doc,
                                                const std::set<std::string>& disabled = {}) {
    auto signature = processWhitelist(doc, disabled, registry, &failure);
    if (!signature) return std::nullopt;
    std::string why;
    auto decoded = decodeSignature(*signature, &why);
    EXPECT_TRUE(decoded) << why;
    if (!decoded) return std::nullopt;
    return decoded->bitmap;
  }

  FixedRegistry registry{{app("org.example.mail"), app("org.example.maps"), app("vendor-tool")}};
  WhitelistFailure failure = WhitelistFailure::unusableFile;
};

TEST_F(WhitelistDocuments, InstalledWhitelistedAppsMakeTheBitmap) {
  auto doc = document(innerWith({{"org.example.mail", {{{"encoding_id", 0}}}},
                                 {"vendor-tool", {{{"encoding_id", 9}}}},
                                 {"org.example.notinstalled", {{{"encoding_id", 3}}}}}));
  EXPECT_EQ(bitmapFor(doc), bytes({0x80, 0x40}));
}

TEST_F(WhitelistDocuments, OnlyTheLastEntryOfAnAppCounts) {
  auto doc =
      document(innerWith({{"org.example.mail", {{{"encoding_id", 20}}, {{"encoding_id", 1}}}},
                          {"org.example.maps", {{{"encoding_id", 5}}, {{"name", "no id"}}}},
                          {"vendor-tool", {{{"encoding_id", 2}}}}}));
  // mail is 1 (not 20), maps is left out, tool still counts.
  EXPECT_EQ(bitmapFor(doc), bytes({0x60}));
}

TEST_F(WhitelistDocuments, IdsThatAreNotUnsignedIntegersAreLeftOut) {
  auto doc = document(innerWith({{"org.example.mail", {{{"encoding_id", -1}}}},
                                 {"org.example.maps", {{{"encoding_id", "4"}}}},
                                 {"vendor-tool", {{{"encoding_id", 1.5}}}}}));
  EXPECT_EQ(bitmapFor(doc), std::nullopt);
  EXPECT_EQ(failure, WhitelistFailure::noWhitelistedApplications);
}

TEST_F(WhitelistDocuments, DisabledAppsAreLeftOut) {
  auto doc = document(innerWith(
      {{"org.example.mail", {{{"encoding_id", 0}}}}, {"vendor-tool", {{{"encoding_id", 9}}}}}));
  EXPECT_EQ(bitmapFor(doc, {"vendor-tool"}), bytes({0x80}));
}

TEST_F(WhitelistDocuments, AppsWithoutVersionOrIdentifierAreLeftOut) {
  registry = FixedRegistry({{"org.example.mail", std::nullopt, false},
                            {"", std::string("1"), false},
                            app("vendor-tool")});
  auto doc = document(innerWith({{"org.example.mail", {{{"encoding_id", 0}}}},
                                 {"", {{{"encoding_id", 1}}}},
                                 {"vendor-tool", {{{"encoding_id", 2}}}}}));
  EXPECT_EQ(bitmapFor(doc), bytes({0x20}));
}

TEST_F(WhitelistDocuments, NoInstalledWhitelistedAppGivesNoSignature) {
  auto doc = document(innerWith({{"org.example.other", {{{"encoding_id", 0}}}}}));
  EXPECT_EQ(processWhitelist(doc, {}, registry, &failure), std::nullopt);
  EXPECT_EQ(failure, WhitelistFailure::noWhitelistedApplications);
}

TEST_F(WhitelistDocuments, MalformedDocumentsGiveNoSignature) {
  auto good = innerWith({{"org.example.mail", {{{"encoding_id", 0}}}}});
  std::string complete = document(good);
  std::vector<std::string> bad = {
      document(good, "rle"),
      document(good, "RLE", "Bitmap"),
      nlohmann::json{{"apps", good.dump()}, {"compression", "RLE"}}.dump(),
      nlohmann::json{{"apps", good}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump(),
      complete.substr(0, complete.size() / 2),
      "[]",
      "",
      nlohmann::json{{"apps", "{not json"}, {"compression", "RLE"}, {"encoding", "bitmap"}}.dump(),
      document({{"apps", {{"org.example.mail", {{{"encoding_id", 0}}}}}}}),
      document({{"version", 7}, {"apps", {{"org.example.mail", {{{"encoding_id", 0}}}}}}}),
      document({{"version", "1"}, {"apps", nlohmann::json::array()}}),
  };
  for (const auto& doc : bad) {
    failure = WhitelistFailure::noWhitelistedApplications;
    EXPECT_EQ(processWhitelist(doc, {}, registry, &failure), std::nullopt) << doc;
    EXPECT_EQ(failure, WhitelistFailure::unusableFile) << doc;
  }
  EXPECT_TRUE(processWhitelist(complete, {}, registry));
}

TEST(WhitelistDocumentOuter, ReturnsTheInnerText) {
  EXPECT_EQ(
      readAppsFromStream(R"({"apps":"{}","compression":"RLE","encoding":"bitmap","extra":1})"),
      "{}");
}

// ---- mapping ----

TEST(MappedWhitelistFile, MapsTheWholeFileAndRefusesAnEmptyOne) {
  testing::TempDir dir;
  testing::writeFile(dir.path() / "full", "hello whitelist");
  testing::writeFile(dir.path() / "empty", "");

  int fd = open((dir.path() / "full").c_str(), O_RDONLY);
  ASSERT_GE(fd, 0);
  auto mapped = mmapFileHandle(fd);
  close(fd);  // the mapping outlives the descriptor
  ASSERT_TRUE(mapped);
  EXPECT_EQ(mapped->bytes(), "hello whitelist");
  MappedFile moved = std::move(*mapped);
  EXPECT_EQ(moved.bytes(), "hello whitelist");

  fd = open((dir.path() / "empty").c_str(), O_RDONLY);
  std::error_code error;
  EXPECT_FALSE(mmapFileHandle(fd, &error));
  EXPECT_EQ(error.value(), EINVAL);
  close(fd);
}

}  // namespace
}  // namespace fbf
