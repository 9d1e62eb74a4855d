#include "flushing/session_filename.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <set>

namespace fbf {
namespace {

constexpr std::string_view kUUID = "6F9619FF-8B86-D011-B42D-00C04FC964FF";

std::string withUUID(std::string_view before, std::string_view after,
                     std::string_view uuid = kUUID) {
  return std::string(before) + std::string(uuid) + std::string(after);
}

TEST(SessionNameGrammar, PlainClosedNameParsesIntoItsFields) {
  auto name = SessionFilename::fromString(withUUID("session.412.", ".closed"));
  ASSERT_TRUE(name);
  EXPECT_EQ(name->processID, 412);
  EXPECT_EQ(name->sessionIDString(), kUUID);
  EXPECT_EQ(name->sessionID[0], 0x6F);
  EXPECT_EQ(name->sessionID[15], 0xFF);
  EXPECT_EQ(name->state, SessionFileState::closed);
  EXPECT_FALSE(name->uploadPending);
  EXPECT_EQ(name->uploadFormat, UploadFormat::json);
  EXPECT_EQ(name->filenameString(), withUUID("session.412.", ".closed"));
}

TEST(SessionNameGrammar, OpenNameIsNotPendingAndJSON) {
  auto name = SessionFilename::fromString(withUUID("session.12.", ".open"));
  ASSERT_TRUE(name);
  EXPECT_EQ(name->state, SessionFileState::open);
  EXPECT_FALSE(name->uploadPending);
  EXPECT_EQ(name->uploadFormat, UploadFormat::json);
}

TEST(SessionNameGrammar, UploadNameCarriesFormatAndPendingFlag) {
  std::string text = withUUID("session.412.", ".processing.pb.uploadPending");
  auto name = SessionFilename::fromString(text);
  ASSERT_TRUE(name);
  EXPECT_EQ(name->state, SessionFileState::processing);
  EXPECT_EQ(name->uploadFormat, UploadFormat::pb);
  EXPECT_TRUE(name->uploadPending);
  EXPECT_EQ(name->uploadFilenameString(), text);
  EXPECT_EQ(name->filenameString(), withUUID("session.412.", ".processing"));
}

TEST(SessionNameGrammar, UnknownFifthPieceKeepsJSONAndNotPending) {
  auto name = SessionFilename::fromString(withUUID("session.12.", ".closed.zip"));
  ASSERT_TRUE(name);
  EXPECT_EQ(name->state, SessionFileState::closed);
  EXPECT_EQ(name->uploadFormat, UploadFormat::json);
  EXPECT_FALSE(name->uploadPending);
}

TEST(SessionNameGrammar, PendingSuffixWithoutFormatStaysJSON) {
  auto name = SessionFilename::fromString(withUUID("session.12.", ".processing.uploadPending"));
  ASSERT_TRUE(name);
  EXPECT_TRUE(name->uploadPending);
  EXPECT_EQ(name->uploadFormat, UploadFormat::json);
  EXPECT_EQ(name->uploadFilenameString(),
            withUUID("session.12.", ".processing.json.uploadPending"));
}

TEST(SessionNameGrammar, PendingOnlyWhenTheWholeNameEndsWithTheSuffix) {
  auto name = SessionFilename::fromString(withUUID("session.12.", ".processing.pb.uploadPendingX"));
  ASSERT_TRUE(name);
  EXPECT_FALSE(name->uploadPending);
  EXPECT_EQ(name->uploadFormat, UploadFormat::pb);
}

TEST(SessionNameGrammar, RejectsTheNegativeExamples) {
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.x.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("Session.12.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12.", "")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12.", ".Open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12.", ".deleted")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("sessions.12.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(""));
  EXPECT_FALSE(SessionFilename::fromString("session"));
  EXPECT_FALSE(SessionFilename::fromString("...."));
}

TEST(SessionNameGrammar, EmptyPiecesAreDropped) {
  auto name = SessionFilename::fromString(withUUID(".session..12..", "..closed."));
  ASSERT_TRUE(name);
  EXPECT_EQ(name->processID, 12);
  EXPECT_EQ(name->state, SessionFileState::closed);
}

TEST(SessionNameGrammar, ProcessIDIsASigned32BitDecimal) {
  auto negative = SessionFilename::fromString(withUUID("session.-7.", ".open"));
  ASSERT_TRUE(negative);
  EXPECT_EQ(negative->processID, -7);
  EXPECT_EQ(negative->filenameString(), withUUID("session.-7.", ".open"));

  auto highest = SessionFilename::fromString(withUUID("session.2147483647.", ".open"));
  ASSERT_TRUE(highest);
  EXPECT_EQ(highest->processID, INT32_MAX);
  auto lowest = SessionFilename::fromString(withUUID("session.-2147483648.", ".open"));
  ASSERT_TRUE(lowest);
  EXPECT_EQ(lowest->processID, INT32_MIN);

  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.2147483648.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.-2147483649.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.99999999999999999999999.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.-.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12a.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session. 12.", ".open")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.0x1F.", ".open")));
}

TEST(SessionNameGrammar, UUIDMustBeCanonicalButHexCaseIsFree) {
  auto lower = SessionFilename::fromString(
      withUUID("session.1.", ".open", "6f9619ff-8b86-d011-b42d-00c04fc964ff"));
  ASSERT_TRUE(lower);
  EXPECT_EQ(lower->sessionIDString(), kUUID);

  for (std::string_view bad :
       {"6F9619FF8B86D011B42D00C04FC964FF", "{6F9619FF-8B86-D011-B42D-00C04FC964FF}",
        "6F9619FF-8B86-D011-B42D-00C04FC964F", "6F9619FF-8B86-D011-B42D-00C04FC964FFF",
        "6F9619F-F8B86-D011-B42D-00C04FC964FF", "6F9619FG-8B86-D011-B42D-00C04FC964FF",
        "6F9619FF 8B86-D011-B42D-00C04FC964FF"}) {
    EXPECT_FALSE(SessionFilename::fromString(withUUID("session.1.", ".open", bad))) << bad;
  }
}

TEST(SessionNameGrammar, NamesAreEqualWhenAllFiveFieldsAre) {
  auto a = SessionFilename::fromString(withUUID("session.1.", ".closed"));
  auto b = SessionFilename::fromString(withUUID("session.1.", ".closed"));
  ASSERT_TRUE(a && b);
  EXPECT_EQ(*a, *b);
  b->uploadPending = true;
  EXPECT_NE(*a, *b);
  b = a;
  b->uploadFormat = UploadFormat::pb;
  EXPECT_NE(*a, *b);
  b = a;
  b->processID = 2;
  EXPECT_NE(*a, *b);
  b = a;
  b->state = SessionFileState::processing;
  EXPECT_NE(*a, *b);
  b = a;
  b->sessionID[7] ^= 1;
  EXPECT_NE(*a, *b);
}

TEST(SessionNameGrammar, StatesAndFormatsRoundTripThroughTheirStrings) {
  for (auto s : {SessionFileState::open, SessionFileState::closed, SessionFileState::processing,
                 SessionFileState::uploaded}) {
    EXPECT_EQ(sessionFileStateFromString(toString(s)), s);
  }
  EXPECT_EQ(toString(SessionFileState::processing), "processing");
  EXPECT_FALSE(sessionFileStateFromString("CLOSED"));
  EXPECT_EQ(uploadFormatFromString("json"), UploadFormat::json);
  EXPECT_EQ(uploadFormatFromString("pb"), UploadFormat::pb);
  EXPECT_FALSE(uploadFormatFromString("JSON"));
  EXPECT_EQ(queryParameterString(UploadFormat::json), "FeedbackV2");
  EXPECT_EQ(queryParameterString(UploadFormat::pb), "FeedbackV2PB");
}

TEST(NewSessionName, HasThisProcessAFreshVersion4UUIDAndDefaults) {
  SessionFilename a;
  SessionFilename b;
  EXPECT_EQ(a.processID, static_cast<int32_t>(getpid()));
  EXPECT_EQ(a.state, SessionFileState::open);
  EXPECT_FALSE(a.uploadPending);
  EXPECT_EQ(a.uploadFormat, UploadFormat::json);
  EXPECT_NE(a.sessionID, b.sessionID);
  EXPECT_EQ(a.sessionID[6] >> 4, 4);
  EXPECT_EQ(a.sessionID[8] >> 6, 2);
  auto parsed = SessionFilename::fromString(a.filenameString());
  ASSERT_TRUE(parsed);
  EXPECT_EQ(*parsed, a);
}

TEST(NewSessionName, UploadNameParsesBackToTheSameFields) {
  SessionFilename a;
  a.state = SessionFileState::processing;
  a.uploadFormat = UploadFormat::pb;
  a.uploadPending = true;
  auto parsed = SessionFilename::fromString(a.uploadFilenameString());
  ASSERT_TRUE(parsed);
  EXPECT_EQ(*parsed, a);
}

TEST(HostileSessionNames, SpacesNewlinesAndNulBytesDoNotParse) {
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12.", ".closed copy")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session 12.", ".closed")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12.", ".closed\n")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12\n.", ".closed")));
  EXPECT_FALSE(
      SessionFilename::fromString(withUUID("session.12.", std::string_view(".open\0", 6))));
}

TEST(HostileSessionNames, InvalidUTF8IsRejectedWhereItMattersAndIgnoredElsewhere) {
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.\xff\xfe.", ".closed")));
  EXPECT_FALSE(SessionFilename::fromString(withUUID("session.12.", ".clos\xc3\x28")));
  auto tail = SessionFilename::fromString(withUUID("session.12.", ".closed.\xff\xfe"));
  ASSERT_TRUE(tail);
  EXPECT_EQ(tail->uploadFormat, UploadFormat::json);
}

TEST(HostileSessionNames, LongestFileNamesAreHandled) {
  std::string longValid = withUUID("session.12.", ".closed.");
  longValid.append(255 - longValid.size(), 'a');
  ASSERT_EQ(longValid.size(), 255u);
  auto name = SessionFilename::fromString(longValid);
  ASSERT_TRUE(name);
  EXPECT_EQ(name->state, SessionFileState::closed);

  EXPECT_FALSE(SessionFilename::fromString(std::string(255, '.')));
  EXPECT_FALSE(SessionFilename::fromString("session." + std::string(247, '9')));
  std::string manyPieces = "session";
  while (manyPieces.size() < 4096) manyPieces += ".x";
  EXPECT_FALSE(SessionFilename::fromString(manyPieces));
}

}  // namespace
}  // namespace fbf
