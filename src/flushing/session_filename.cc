#include "flushing/session_filename.h"

#include "assembly/fbf_strings.h"

#include <unistd.h>

#include <random>

namespace fbf {
namespace {

constexpr std::string_view kStateNames[] = {"open", "closed", "processing", "uploaded"};
constexpr std::string_view kFormatNames[] = {"json", "pb"};

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// A decimal 32-bit signed integer: an optional sign and at least one digit,
// nothing else.
std::optional<int32_t> parseProcessID(std::string_view text) {
  std::string_view digits = text;
  bool negative = false;
  if (!digits.empty() && (digits.front() == '+' || digits.front() == '-')) {
    negative = digits.front() == '-';
    digits.remove_prefix(1);
  }
  if (digits.empty()) return std::nullopt;
  int64_t value = 0;
  for (char c : digits) {
    if (c < '0' || c > '9') return std::nullopt;
    value = value * 10 + (c - '0');
    if (value > int64_t{INT32_MAX} + 1) return std::nullopt;
  }
  if (negative) value = -value;
  if (value < INT32_MIN || value > INT32_MAX) return std::nullopt;
  return static_cast<int32_t>(value);
}

}  // namespace

std::string_view toString(SessionFileState s) { return kStateNames[static_cast<int>(s)]; }

std::optional<SessionFileState> sessionFileStateFromString(std::string_view s) {
  for (int i = 0; i < 4; ++i) {
    if (kStateNames[i] == s) return static_cast<SessionFileState>(i);
  }
  return std::nullopt;
}

std::string_view toString(UploadFormat f) { return kFormatNames[static_cast<int>(f)]; }

std::optional<UploadFormat> uploadFormatFromString(std::string_view s) {
  for (int i = 0; i < 2; ++i) {
    if (kFormatNames[i] == s) return static_cast<UploadFormat>(i);
  }
  return std::nullopt;
}

std::string_view queryParameterString(UploadFormat f) {
  return f == UploadFormat::pb ? FBFStrings::VireonProtobufFeedbackType
                               : FBFStrings::VireonFeedbackType;
}

std::optional<std::array<uint8_t, 16>> parseUUID(std::string_view text) {
  if (text.size() != 36) return std::nullopt;
  std::array<uint8_t, 16> out{};
  size_t byte = 0;
  for (size_t i = 0; i < 36;) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (text[i] != '-') return std::nullopt;
      ++i;
      continue;
    }
    int hi = hexValue(text[i]);
    int lo = hexValue(text[i + 1]);
    if (hi < 0 || lo < 0) return std::nullopt;
    out[byte++] = static_cast<uint8_t>(hi << 4 | lo);
    i += 2;
  }
  return out;
}

SessionFilename::SessionFilename() : processID(static_cast<int32_t>(getpid())) {
  std::random_device rd;
  for (size_t i = 0; i < sessionID.size(); i += 4) {
    uint32_t r = rd();
    for (size_t j = 0; j < 4; ++j) sessionID[i + j] = static_cast<uint8_t>(r >> (8 * j));
  }
  // RFC 4122 version 4, variant 1.
  sessionID[6] = static_cast<uint8_t>((sessionID[6] & 0x0F) | 0x40);
  sessionID[8] = static_cast<uint8_t>((sessionID[8] & 0x3F) | 0x80);
}

std::optional<SessionFilename> SessionFilename::fromString(std::string_view name) {
  // Only the first five pieces matter; the rest is never looked at.
  std::string_view pieces[5];
  size_t count = 0;
  size_t pos = 0;
  while (pos <= name.size() && count < 5) {
    size_t dot = name.find('.', pos);
    size_t end = dot == std::string_view::npos ? name.size() : dot;
    if (end > pos) pieces[count++] = name.substr(pos, end - pos);
    if (dot == std::string_view::npos) break;
    pos = dot + 1;
  }
  if (count < 4) return std::nullopt;
  if (pieces[0] != kVireonSessionFileNamePrefix) return std::nullopt;
  auto pid = parseProcessID(pieces[1]);
  if (!pid) return std::nullopt;
  auto uuid = parseUUID(pieces[2]);
  if (!uuid) return std::nullopt;
  auto state = sessionFileStateFromString(pieces[3]);
  if (!state) return std::nullopt;

  SessionFilename result{Blank{}};
  result.sessionID = *uuid;
  result.processID = *pid;
  result.state = *state;
  if (count >= 5) {
    if (auto format = uploadFormatFromString(pieces[4])) result.uploadFormat = *format;
  }
  result.uploadPending = name.ends_with(FBFStrings::UploadPendingSuffix);
  return result;
}

std::string SessionFilename::sessionIDString() const {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (size_t i = 0; i < sessionID.size(); ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out.push_back('-');
    out.push_back(kHex[sessionID[i] >> 4]);
    out.push_back(kHex[sessionID[i] & 0x0F]);
  }
  return out;
}

std::string SessionFilename::filenameString() const {
  std::string out(kVireonSessionFileNamePrefix);
  out += '.';
  out += std::to_string(processID);
  out += '.';
  out += sessionIDString();
  out += '.';
  out += toString(state);
  return out;
}

std::string SessionFilename::uploadFilenameString() const {
  std::string out = filenameString();
  out += '.';
  out += toString(uploadFormat);
  out += FBFStrings::UploadPendingSuffix;
  return out;
}

}  // namespace fbf
