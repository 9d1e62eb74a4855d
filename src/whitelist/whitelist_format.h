// The installed-app whitelist signature: which installed applications appear
// in the search service's whitelist resource, as a bitmap of their encoding
// ids, run-length coded when that is shorter, framed with a version word, the
// bitmap length and a CRC-32, and written as base64.
//
// Record layout (big-endian): CRC-32 of the rest (4) | compressed flag in bit
// 15 and version in bits 14-0 (2) | bitmap length (2) | payload. Payload: the
// last 4 bytes of the bitmap's MD5, then either the bitmap itself or the run
// coding: run count C (2), C bytes of (run length - 1), ceil(C/8) bytes of
// run-kind flags (1 = ones), most significant bit first.
//
// Every function is pure apart from logging and the registry enumeration;
// callable from any thread.
#pragma once

#include "platform/user_defaults.h"
#include "whitelist/application_registry.h"

#include <cstdint>
#include <optional>
#include <set>
#include <span>
#include <string>
#include <string_view>
#include <system_error>
#include <vector>

#include <nlohmann/json.hpp>

namespace fbf {

// Hard limits of the record: lengths are 16-bit fields. Going past them is a
// programming or packaging error and stops the process.
inline constexpr size_t kMaximumBitmapLength = 65535;
inline constexpr size_t kPayloadLengthLimit = 65532;  // payloads must stay below

// A whole file mapped read-only and private; unmapped when destroyed.
class MappedFile {
 public:
  MappedFile(MappedFile&& other) noexcept;
  MappedFile& operator=(MappedFile&& other) noexcept;
  MappedFile(const MappedFile&) = delete;
  MappedFile& operator=(const MappedFile&) = delete;
  ~MappedFile();

  std::string_view bytes() const { return {static_cast<const char*>(data_), size_}; }

 private:
  friend std::optional<MappedFile> mmapFileHandle(int fd, std::error_code* error);
  MappedFile(void* data, size_t size) : data_(data), size_(size) {}
  void* data_ = nullptr;
  size_t size_ = 0;
};

// Maps the open file from offset 0 to its end offset. No value when the
// mapping fails (an empty file included); `error` then holds errno.
std::optional<MappedFile> mmapFileHandle(int fd, std::error_code* error = nullptr);

// The outer document: an object whose "compression" is "RLE", "encoding" is
// "bitmap" and "apps" is a string. Returns that string (the inner document),
// or no value on any parse error or mismatch.
std::optional<std::string> readAppsFromStream(std::string_view document);

// Ids of the installed applications listed in `apps` (the inner document's
// "apps" object), sorted ascending. Applications the user disabled, entries
// without a bundle identifier or version, and applications whose last array
// element has no unsigned "encoding_id" are left out.
std::vector<uint64_t> findWhitelistedApplications(const nlohmann::json& apps,
                                                  const std::set<std::string>& manuallyDisabledApps,
                                                  const ApplicationRegistry& registry);

// Why `processWhitelist` produced no signature.
enum class WhitelistFailure { unusableFile, noWhitelistedApplications };

// The whole pipeline over the whitelist file's bytes. No value when the file
// is unusable or no installed application is whitelisted; `failure` says which.
std::optional<std::string> processWhitelist(std::string_view document,
                                            const std::set<std::string>& manuallyDisabledApps,
                                            const ApplicationRegistry& registry,
                                            WhitelistFailure* failure = nullptr);

// Bundle identifiers the user disabled for search (empty when unset).
std::set<std::string> getManuallyDisabledApps(PreferencesStore& preferences);

// Bit i set for each id i; (largest id / 8) + 1 bytes. A bitmap longer than
// kMaximumBitmapLength stops the process. `ids` must be sorted and non-empty.
std::vector<uint8_t> makeBitmap(const std::vector<uint64_t>& ids);

// The runs of equal bits, most significant bit of each byte first, cut at 256
// bits: one count byte (length - 1) and one flag bit per run.
struct BitRuns {
  std::vector<uint8_t> counts;
  std::vector<uint8_t> flags;  // ceil(counts.size() / 8) bytes, low end zero-padded
};
BitRuns collectRuns(std::span<const uint8_t> bitmap);

// Appends either the run coding (returns 1) or, when that is not strictly
// shorter than the bitmap, the bitmap itself (returns 0).
int encodeRun(std::span<const uint8_t> bitmap, std::vector<uint8_t>& out);

// Appends the 4 digest bytes and the coded bitmap; returns encodeRun's flag.
int rle_compress(std::span<const uint8_t> bitmap, std::vector<uint8_t>& out);

// The last four bytes of `version` (with its terminating zero when shorter)
// read as hex digits, raw bytes kept for non-hex characters, top bit dropped;
// bit 15 set when compressed.
uint16_t makeCompressionFlagAndVersion(bool compressed, std::string_view version);

// The framed, CRC-protected base64 record. A payload of kPayloadLengthLimit
// bytes or more stops the process.
std::string makeSignature(std::span<const uint8_t> payload, uint16_t bitmapLength, bool compressed,
                          std::string_view version);

// Bitmap, coding and record for a sorted, non-empty id list.
std::string signatureForIds(const std::vector<uint64_t>& ids, std::string_view version);

}  // namespace fbf
