#include "whitelist/whitelist_format.h"

#include "assembly/fbf_strings.h"
#include "platform/logging.h"
#include "util/lock.h"

#include <openssl/evp.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <zlib.h>

#include <algorithm>
#include <cerrno>

namespace fbf {
namespace {

spdlog::logger& formatLog() { return logging::get("WhitelistFormat"); }

constexpr size_t kDigestTailOffset = 12;
constexpr size_t kDigestTailLength = 4;
constexpr size_t kRecordHeaderLength = 8;
constexpr unsigned kMaximumRunBits = 256;

void putBigEndian16(uint8_t* at, uint16_t v) {
  at[0] = static_cast<uint8_t>(v >> 8);
  at[1] = static_cast<uint8_t>(v);
}

// Builds counts and flags one run at a time.
class RunCollector {
 public:
  explicit RunCollector(size_t bitmapLength) {
    // A bitmap of n bytes has at most 8n runs (every bit its own run), so
    // these never grow while collecting.
    runs_.counts.reserve(bitmapLength * 8);
    runs_.flags.reserve(bitmapLength);
  }

  // Closes a run of `length` bits (1...256) of the given kind.
  void saveRun(unsigned length, bool ones) {
    runs_.counts.push_back(static_cast<uint8_t>(length - 1));
    size_t index = runs_.counts.size() - 1;
    if (index % 8 == 0) runs_.flags.push_back(0);
    if (ones) runs_.flags.back() |= static_cast<uint8_t>(0x80u >> (index % 8));
  }

  BitRuns take() { return std::move(runs_); }

 private:
  BitRuns runs_;
};

}  // namespace

// ---- mapping ----

MappedFile::MappedFile(MappedFile&& other) noexcept : data_(other.data_), size_(other.size_) {
  other.data_ = nullptr;
  other.size_ = 0;
}

MappedFile& MappedFile::operator=(MappedFile&& other) noexcept {
  if (this != &other) {
    if (data_) munmap(data_, size_);
    data_ = other.data_;
    size_ = other.size_;
    other.data_ = nullptr;
    other.size_ = 0;
  }
  return *this;
}

MappedFile::~MappedFile() {
  if (data_) munmap(data_, size_);
}

std::optional<MappedFile> mmapFileHandle(int fd, std::error_code* error) {
  struct stat st {};
  if (fstat(fd, &st) != 0) {
    if (error) *error = {errno, std::generic_category()};
    return std::nullopt;
  }
  auto length = static_cast<size_t>(st.st_size);
  void* p = mmap(nullptr, length, PROT_READ, MAP_PRIVATE, fd, 0);
  if (p == MAP_FAILED) {
    if (error) *error = {errno, std::generic_category()};
    return std::nullopt;
  }
  return MappedFile(p, length);
}

// ---- reading the resource ----

std::optional<std::string> readAppsFromStream(std::string_view document) {
  auto outer = nlohmann::json::parse(document.begin(), document.end(), nullptr, false);
  if (outer.is_discarded() || !outer.is_object()) return std::nullopt;
  auto apps = outer.find("apps");
  auto compression = outer.find("compression");
  auto encoding = outer.find("encoding");
  if (apps == outer.end() || compression == outer.end() || encoding == outer.end())
    return std::nullopt;
  if (!apps->is_string() || !compression->is_string() || !encoding->is_string())
    return std::nullopt;
  if (compression->get_ref<const std::string&>() != "RLE") return std::nullopt;
  if (encoding->get_ref<const std::string&>() != "bitmap") return std::nullopt;
  return apps->get<std::string>();
}

std::vector<uint64_t> findWhitelistedApplications(const nlohmann::json& apps,
                                                  const std::set<std::string>& manuallyDisabledApps,
                                                  const ApplicationRegistry& registry) {
  std::vector<uint64_t> ids;
  for (const auto& app : registry.installedApplications()) {
    if (!app.bundleVersion || app.bundleIdentifier.empty()) continue;
    if (manuallyDisabledApps.count(app.bundleIdentifier)) continue;
    auto entries = apps.find(app.bundleIdentifier);
    if (entries == apps.end() || !entries->is_array() || entries->empty()) continue;
    const auto& last = entries->back();
    if (!last.is_object()) continue;
    auto id = last.find("encoding_id");
    if (id == last.end() || !id->is_number_unsigned()) continue;
    ids.push_back(id->get<uint64_t>());
  }
  std::sort(ids.begin(), ids.end());
  return ids;
}

std::optional<std::string> processWhitelist(std::string_view document,
                                            const std::set<std::string>& manuallyDisabledApps,
                                            const ApplicationRegistry& registry,
                                            WhitelistFailure* failure) {
  auto fail = [&](WhitelistFailure why) -> std::optional<std::string> {
    if (failure) *failure = why;
    return std::nullopt;
  };
  auto inner = readAppsFromStream(document);
  if (!inner) return fail(WhitelistFailure::unusableFile);
  auto whitelist = nlohmann::json::parse(*inner, nullptr, false);
  if (whitelist.is_discarded() || !whitelist.is_object())
    return fail(WhitelistFailure::unusableFile);
  auto version = whitelist.find("version");
  auto apps = whitelist.find("apps");
  if (version == whitelist.end() || !version->is_string() || apps == whitelist.end() ||
      !apps->is_object()) {
    return fail(WhitelistFailure::unusableFile);
  }
  auto ids = findWhitelistedApplications(*apps, manuallyDisabledApps, registry);
  if (ids.empty()) return fail(WhitelistFailure::noWhitelistedApplications);
  return signatureForIds(ids, version->get_ref<const std::string&>());
}

std::set<std::string> getManuallyDisabledApps(PreferencesStore& preferences) {
  auto defaults =
      preferences.defaultsForDomain(std::string(FBFStrings::LinuxDefaults::SearchUIDomain));
  if (!defaults) return {};
  auto list = defaults->stringArrayForKey(FBFStrings::LinuxDefaults::DisabledApplications);
  if (!list) return {};
  return {list->begin(), list->end()};
}

// ---- bitmap and run coding ----

std::vector<uint8_t> makeBitmap(const std::vector<uint64_t>& ids) {
  if (ids.empty()) FBF_FATAL("whitelist bitmap without ids");
  uint64_t largest = ids.back();
  uint64_t length = largest / 8 + 1;
  if (length > kMaximumBitmapLength) FBF_FATAL("whitelist bitmap too long");
  std::vector<uint8_t> bitmap(static_cast<size_t>(length), 0);
  for (uint64_t id : ids) bitmap[id / 8] |= static_cast<uint8_t>(0x80u >> (id % 8));
  return bitmap;
}

BitRuns collectRuns(std::span<const uint8_t> bitmap) {
  RunCollector collector(bitmap.size());
  if (bitmap.empty()) return collector.take();
  bool current = (bitmap[0] & 0x80) != 0;
  unsigned length = 0;
  for (uint8_t byte : bitmap) {
    for (unsigned bit = 0; bit < 8; ++bit) {
      bool value = (byte & (0x80u >> bit)) != 0;
      if (value != current || length == kMaximumRunBits) {
        collector.saveRun(length, current);
        current = value;
        length = 0;
      }
      ++length;
    }
  }
  collector.saveRun(length, current);
  return collector.take();
}

int encodeRun(std::span<const uint8_t> bitmap, std::vector<uint8_t>& out) {
  BitRuns runs = collectRuns(bitmap);
  size_t codedLength = 2 + runs.counts.size() + runs.flags.size();
  // Only when strictly shorter than the bitmap itself; this also keeps the
  // run count within its 16-bit field.
  if (codedLength >= bitmap.size()) {
    out.insert(out.end(), bitmap.begin(), bitmap.end());
    return 0;
  }
  uint8_t count[2];
  putBigEndian16(count, static_cast<uint16_t>(runs.counts.size()));
  out.insert(out.end(), count, count + 2);
  out.insert(out.end(), runs.counts.begin(), runs.counts.end());
  out.insert(out.end(), runs.flags.begin(), runs.flags.end());
  return 1;
}

int rle_compress(std::span<const uint8_t> bitmap, std::vector<uint8_t>& out) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int digestLength = 0;
  if (EVP_Digest(bitmap.data(), bitmap.size(), digest, &digestLength, EVP_md5(), nullptr) != 1 ||
      digestLength != 16) {
    FBF_FATAL("MD5 digest failed");
  }
  out.insert(out.end(), digest + kDigestTailOffset, digest + kDigestTailOffset + kDigestTailLength);
  return encodeRun(bitmap, out);
}

// ---- the record ----

uint16_t makeCompressionFlagAndVersion(bool compressed, std::string_view version) {
  // The version's bytes plus the terminating zero; the zero is read only when
  // the version is shorter than four bytes.
  std::string bytes(version);
  bytes.push_back('\0');
  std::string_view used = version.size() >= 4 ? std::string_view(version).substr(version.size() - 4)
                                              : std::string_view(bytes);
  uint32_t value = 0;
  for (size_t k = 0; k < used.size() && k < 4; ++k) {
    auto c = static_cast<unsigned char>(used[k]);
    uint32_t digit;
    if (c >= '0' && c <= '9') {
      digit = c - '0';
    } else if (c >= 'a' && c <= 'f') {
      digit = c - 'a' + 10;
    } else if (c >= 'A' && c <= 'F') {
      digit = c - 'A' + 10;
    } else {
      formatLog().debug("whitelist: invalid hex character in version string");
      digit = c;
    }
    value |= digit << (4 * (3 - k));
  }
  auto word = static_cast<uint16_t>(value & 0x7FFF);
  if (compressed) word |= 0x8000;
  return word;
}

std::string makeSignature(std::span<const uint8_t> payload, uint16_t bitmapLength, bool compressed,
                          std::string_view version) {
  if (payload.size() >= kPayloadLengthLimit) FBF_FATAL("whitelist payload too long");
  std::vector<uint8_t> record(payload.size() + kRecordHeaderLength, 0);
  putBigEndian16(&record[4], makeCompressionFlagAndVersion(compressed, version));
  putBigEndian16(&record[6], bitmapLength);
  std::copy(payload.begin(), payload.end(), record.begin() + kRecordHeaderLength);
  uLong crc = crc32(0L, record.data() + 4, static_cast<uInt>(record.size() - 4));
  record[0] = static_cast<uint8_t>(crc >> 24);
  record[1] = static_cast<uint8_t>(crc >> 16);
  record[2] = static_cast<uint8_t>(crc >> 8);
  record[3] = static_cast<uint8_t>(crc);

  std::string text(4 * ((record.size() + 2) / 3) + 1, '\0');
  int written = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(text.data()), record.data(),
                                static_cast<int>(record.size()));
  if (written < 0) FBF_FATAL("base64 encoding failed");
  text.resize(static_cast<size_t>(written));
  return text;
}

std::string signatureForIds(const std::vector<uint64_t>& ids, std::string_view version) {
  std::vector<uint8_t> bitmap = makeBitmap(ids);
  std::vector<uint8_t> payload;
  payload.reserve(bitmap.size() + kDigestTailLength);
  bool compressed = rle_compress(bitmap, payload) == 1;
  return makeSignature(payload, static_cast<uint16_t>(bitmap.size()), compressed, version);
}

}  // namespace fbf
