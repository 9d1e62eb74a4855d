// Guards against: a session name parsed into the wrong fields, or a malformed one accepted.
#include "flushing/session_filename.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace fbf {
namespace {

using S = SessionFileState;
using F = UploadFormat;
using namespace std::string_view_literals;

constexpr std::string_view kUUID = "6F9619FF-8B86-D011-B42D-00C04FC964FF";

std::string named(std::string_view before, std::string_view after, std::string_view uuid = kUUID) {
  return std::string(before) + std::string(uuid) + std::string(after);
}

TEST(SessionNameGrammar, EachWellFormedNameParsesIntoItsFieldsAndBack) {
  std::string longest = named("session.12.", ".closed.");
  longest.append(255 - longest.size(), 'a');
  struct Row {
    const char* name;
    std::string text;
    S state;
    int32_t pid = 12;
    F format = F::json;
    bool pending = false;
  };
  const Row rows[] = {
      {"plain closed", named("session.412.", ".closed"), S::closed, 412},
      {"open", named("session.12.", ".open"), S::open},
      {"upload name", named("session.412.", ".processing.pb.uploadPending"), S::processing, 412,
       F::pb, true},
      {"pending without format", named("session.12.", ".processing.uploadPending"), S::processing,
       12, F::json, true},
      {"suffix not at the very end", named("session.12.", ".processing.pb.uploadPendingX"),
       S::processing, 12, F::pb},
      {"empty pieces are dropped", named(".session..12..", "..closed."), S::closed},
      {"highest pid", named("session.2147483647.", ".open"), S::open, INT32_MAX},
      {"lowest pid", named("session.-2147483648.", ".open"), S::open, INT32_MIN},
      {"lower-case UUID", named("session.1.", ".uploaded", "6f9619ff-8b86-d011-b42d-00c04fc964ff"),
       S::uploaded, 1},
      {"invalid UTF-8 after the state", named("session.12.", ".closed.\xff\xfe"), S::closed},
      {"longest file name", longest, S::closed},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    auto name = SessionFilename::fromString(row.text);
    ASSERT_TRUE(name);
    EXPECT_EQ(name->processID, row.pid);
    EXPECT_EQ(name->state, row.state);
    EXPECT_EQ(name->uploadFormat, row.format);
    EXPECT_EQ(name->uploadPending, row.pending);
    EXPECT_EQ(name->sessionIDString(), kUUID);
    std::string plain = "session." + std::to_string(row.pid) + "." + std::string(kUUID) + "." +
                        std::string(toString(row.state));
    EXPECT_EQ(name->filenameString(), plain);
    EXPECT_EQ(name->uploadFilenameString(),
              plain + "." + std::string(toString(row.format)) + ".uploadPending");
  }
}

TEST(SessionNameGrammar, MalformedAndHostileNamesAreRejected) {
  std::string manyPieces = "session";
  while (manyPieces.size() < 4096) manyPieces += ".x";
  // '@' stands for the canonical UUID.
  std::vector<std::string> rejected = {
      "session.x.@.open", "Session.12.@.open", "session.12.@", "session.12.@.Open",
      "session.12.@.deleted", "sessions.12.@.open", "", "session", "....",
      // process IDs: 32-bit signed decimal only
      "session.2147483648.@.open", "session.-2147483649.@.open",
      "session.99999999999999999999999.@.open", "session.-.@.open", "session.12a.@.open",
      "session. 12.@.open", "session.0x1F.@.open",
      // spaces, newlines, NUL bytes and invalid UTF-8 where they matter
      "session.12.@.closed copy", "session 12.@.closed", "session.12.@.closed\n",
      "session.12\n.@.closed", "session.\xff\xfe.@.closed", "session.12.@.clos\xc3\x28",
      // UUIDs: canonical form only
      "session.1.6F9619FF8B86D011B42D00C04FC964FF.open",
      "session.1.{6F9619FF-8B86-D011-B42D-00C04FC964FF}.open",
      "session.1.6F9619FF-8B86-D011-B42D-00C04FC964F.open",
      "session.1.6F9619FF-8B86-D011-B42D-00C04FC964FFF.open",
      "session.1.6F9619F-F8B86-D011-B42D-00C04FC964FF.open",
      "session.1.6F9619FG-8B86-D011-B42D-00C04FC964FF.open",
      "session.1.6F9619FF 8B86-D011-B42D-00C04FC964FF.open",
      // overlong
      std::string(255, '.'), "session." + std::string(247, '9'), manyPieces,
      named("session.12.", ".open\0"sv)};
  for (auto& text : rejected) {
    if (auto at = text.find('@'); at != std::string::npos) text.replace(at, 1, kUUID);
  }
  for (const auto& text : rejected) EXPECT_FALSE(SessionFilename::fromString(text)) << text;
}

// Guards against: new sessions sharing an ID, or named for another process.
TEST(NewSessionName, HasThisProcessAFreshVersion4UUIDAndParsesBack) {
  SessionFilename a;
  SessionFilename b;
  EXPECT_EQ(a.processID, static_cast<int32_t>(getpid()));
  EXPECT_EQ(a.state, S::open);
  EXPECT_NE(a.sessionID, b.sessionID);
  EXPECT_EQ(a.sessionID[6] >> 4, 4);
  EXPECT_EQ(a.sessionID[8] >> 6, 2);
  EXPECT_EQ(SessionFilename::fromString(a.filenameString()), a);
}

}  // namespace
}  // namespace fbf
