// The session file-name grammar.
//
// The search daemon writes one file per search session into the shared cache
// directory, and each file carries its life-cycle state in its own name:
//
//   session.<pid>.<UUID>.<state>                        (plain name)
//   session.<pid>.<UUID>.<state>.<format>.uploadPending (upload name)
//
// so the state survives a crash of either process without any database.
// `SessionFilename` parses and formats these names. Parsing never throws: a
// name that does not follow the grammar simply yields no value, whatever bytes
// it holds (spaces, newlines, invalid UTF-8, any length).
// Thread-safety: a plain value; the free functions are pure.
#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace fbf {

enum class SessionFileState { open, closed, processing, uploaded };
enum class UploadFormat { json, pb };

// "open", "closed", "processing", "uploaded"; any other string is not a state.
std::string_view toString(SessionFileState s);
std::optional<SessionFileState> sessionFileStateFromString(std::string_view s);
// "json", "pb".
std::string_view toString(UploadFormat f);
std::optional<UploadFormat> uploadFormatFromString(std::string_view s);
// The feedback type the upload request names: "FeedbackV2" / "FeedbackV2PB".
std::string_view queryParameterString(UploadFormat f);

inline constexpr std::string_view kVireonSessionFileNamePrefix = "session";

class SessionFilename {
 public:
  // A name for a new session: a fresh random (version 4) UUID, this process's
  // id, state open, no upload pending, JSON.
  SessionFilename();

  // Splits at every "." (empty pieces dropped) and reads "session", a decimal
  // 32-bit process id, a canonical 36-character UUID (hex digits in either
  // case) and a state; an optional fifth piece that is a format sets the
  // format. `uploadPending` is true when the whole name ends in
  // ".uploadPending". No value for anything else.
  static std::optional<SessionFilename> fromString(std::string_view name);

  std::array<uint8_t, 16> sessionID{};
  int32_t processID = 0;
  SessionFileState state = SessionFileState::open;
  bool uploadPending = false;
  UploadFormat uploadFormat = UploadFormat::json;

  // Canonical upper-case 8-4-4-4-12 form.
  std::string sessionIDString() const;
  // session.<pid>.<UUID>.<state>
  std::string filenameString() const;
  // The plain name + ".<format>.uploadPending".
  std::string uploadFilenameString() const;

  bool operator==(const SessionFilename&) const = default;

 private:
  struct Blank {};
  explicit SessionFilename(Blank) {}
};

// Parses a canonical hyphenated UUID (36 characters, hex in either case).
std::optional<std::array<uint8_t, 16>> parseUUID(std::string_view text);

}  // namespace fbf
