#include "flushing/cache_layout.h"
#include "assembly/feedback_types.h"
#include "flushing/feedback_enumerator.h"
#include "flushing/flushing_test_util.h"
#include "support/test_support.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace fbf::testing {
namespace {

class SessionStateChange : public ::testing::Test {
 protected:
  FileManager& fm() { return *env.fileManager; }
  TestEnvironment env;
};

TEST_F(SessionStateChange, ClosedFileMovesToProcessingWithItsContents) {
  auto file = makeFile(env.cacheDir(), sessionName(SessionFileState::closed, 1), "payload");
  std::error_code error;
  auto moved = vireon_renameForStateChange(fm(), file, SessionFileState::processing, error);
  ASSERT_TRUE(moved) << error.message();
  EXPECT_EQ(*moved, env.cacheDir() / sessionName(SessionFileState::processing, 1));
  EXPECT_FALSE(fs::exists(file));
  EXPECT_EQ(readFile(*moved), "payload");
}

TEST_F(SessionStateChange, UploadNameBecomesThePlainNameOfTheNewState) {
  auto file =
      makeFile(env.cacheDir(), sessionName(SessionFileState::processing, 1) + ".pb.uploadPending");
  std::error_code error;
  auto moved = vireon_renameForStateChange(fm(), file, SessionFileState::uploaded, error);
  ASSERT_TRUE(moved);
  EXPECT_EQ(moved->filename(), sessionName(SessionFileState::uploaded, 1));
}

TEST_F(SessionStateChange, FailuresLeaveEverythingInPlaceAndSayWhy) {
  std::error_code error;
  auto junk = makeFile(env.cacheDir(), "session.junk");
  EXPECT_FALSE(vireon_renameForStateChange(fm(), junk, SessionFileState::processing, error));
  EXPECT_EQ(error, std::errc::invalid_argument);
  EXPECT_TRUE(fs::exists(junk));

  error.clear();
  EXPECT_FALSE(
      vireon_renameForStateChange(fm(), env.cacheDir() / sessionName(SessionFileState::closed, 9),
                                  SessionFileState::processing, error));
  EXPECT_EQ(error, std::errc::no_such_file_or_directory);

  error.clear();
  auto closed = makeFile(env.cacheDir(), sessionName(SessionFileState::closed, 2), "new");
  auto processing = makeFile(env.cacheDir(), sessionName(SessionFileState::processing, 2), "old");
  EXPECT_FALSE(vireon_renameForStateChange(fm(), closed, SessionFileState::processing, error));
  EXPECT_EQ(error, std::errc::file_exists);
  EXPECT_EQ(readFile(closed), "new");
  EXPECT_EQ(readFile(processing), "old");
}

class CacheSubdirectories : public ::testing::Test {
 protected:
  TestEnvironment env;
  LogCapture logs;
};

TEST_F(CacheSubdirectories, AreCreatedOwnerOnly) {
  createRequiredCacheSubdirectories(*env.fileManager);
  for (const char* name : {"CustomFeedback", "Cohorts"}) {
    auto attrs = env.fileManager->attributes(env.cacheDir() / name);
    ASSERT_TRUE(attrs) << name;
    EXPECT_TRUE(attrs->isDirectory());
    EXPECT_EQ(attrs->mode, 0700u) << name;
  }
}

TEST_F(CacheSubdirectories, LoosePermissionsAreRepaired) {
  fs::create_directories(env.cacheDir() / "Cohorts");
  chmod((env.cacheDir() / "Cohorts").c_str(), 0755);
  createRequiredCacheSubdirectories(*env.fileManager);
  EXPECT_EQ(env.fileManager->attributes(env.cacheDir() / "Cohorts")->mode, 0700u);
}

TEST_F(CacheSubdirectories, AFileInTheWayIsLoggedAndTheOtherIsStillMade) {
  makeFile(env.cacheDir(), "CustomFeedback", "not a directory");
  createRequiredCacheSubdirectories(*env.fileManager);
  EXPECT_TRUE(logs.contains("Error making vireond caches subdir: "));
  EXPECT_TRUE(fs::is_directory(env.cacheDir() / "Cohorts"));
  EXPECT_TRUE(fs::is_regular_file(env.cacheDir() / "CustomFeedback"));
}

TEST_F(CacheSubdirectories, WithoutACachesDirectoryNothingIsMade) {
  fs::remove_all(env.dirs.cacheHome);
  createRequiredCacheSubdirectories(*env.fileManager);
  EXPECT_TRUE(logs.contains("unable to obtain cache directory"));
  EXPECT_FALSE(fs::exists(env.dirs.cacheHome));
}

class PersistingCustomFeedback : public ::testing::Test {
 protected:
  TestEnvironment env;
  LogCapture logs;
};

TEST_F(PersistingCustomFeedback, RecordLandsInItsTypeDirectoryOwnerOnlyAndIsEnumerated) {
  auto path = persistCustomFeedback(*env.fileManager, "cohort bytes", 11, "cohort-1");
  ASSERT_TRUE(path);
  EXPECT_EQ(*path, env.cacheDir() / "CustomFeedback" / "Usage" / "cohort-1");
  EXPECT_EQ(readFile(*path), "cohort bytes");
  EXPECT_EQ(env.fileManager->attributes(*path)->mode, 0600u);
  EXPECT_EQ(env.fileManager->attributes(path->parent_path())->mode, 0700u);

  auto enumerator = FeedbackEnumerator::make(*env.fileManager);
  ASSERT_TRUE(enumerator);
  auto file = enumerator->next();
  ASSERT_TRUE(file);
  EXPECT_EQ(file->fileURL, *path);
  EXPECT_EQ(file->fileType, FeedbackFileType::custom);
  EXPECT_EQ(file->typeString(), "Usage");
}

TEST_F(PersistingCustomFeedback, TypesWithoutADirectoryAreRefused) {
  EXPECT_FALSE(persistCustomFeedback(*env.fileManager, "x", 0, "a"));
  EXPECT_FALSE(persistCustomFeedback(*env.fileManager, "x", 14, "b"));
  EXPECT_FALSE(persistCustomFeedback(*env.fileManager, "x", 99, "c"));
  EXPECT_TRUE(logs.contains("error persisting custom feedback at " +
                            (env.cacheDir() / "CustomFeedback" / "(unknown: 99)").string() + "/c"));
  EXPECT_FALSE(fs::exists(env.cacheDir() / "CustomFeedback" / "unknown"));
  EXPECT_FALSE(fs::exists(env.cacheDir() / "CustomFeedback" / "last_"));
}

TEST_F(PersistingCustomFeedback, FileNamesCannotEscapeTheTypeDirectory) {
  using namespace std::string_view_literals;
  for (std::string_view name : {""sv, "."sv, ".."sv, "../escape"sv, "a/b"sv, "a\0b"sv}) {
    EXPECT_FALSE(persistCustomFeedback(*env.fileManager, "x", 2, name));
  }
  EXPECT_FALSE(fs::exists(env.cacheDir() / "CustomFeedback" / "escape"));
  EXPECT_EQ(logs.count("error persisting custom feedback at"), 6u);
}

TEST(RemovingItems, AFailureIsLoggedWithTheCallersMessage) {
  TestEnvironment env;
  LogCapture logs;
  auto file = makeFile(env.cacheDir(), "x");
  EXPECT_TRUE(vireon_removeItemOrLogError(*env.fileManager, file, "Could not drop x"));
  EXPECT_FALSE(fs::exists(file));
  EXPECT_FALSE(vireon_removeItemOrLogError(*env.fileManager, file, "Could not drop x"));
  EXPECT_TRUE(logs.contains("Could not drop x: No such file or directory"));
}

TEST(UploadsLeftPending, AreListedOldestFirst) {
  TestEnvironment env;
  makeFile(env.cacheDir(), sessionName(SessionFileState::closed, 1));
  auto second = makeFile(env.cacheDir(),
                         sessionName(SessionFileState::processing, 3) + ".json.uploadPending");
  auto first =
      makeFileCreatedAfter(*env.fileManager, second, env.cacheDir(),
                           sessionName(SessionFileState::processing, 2) + ".pb.uploadPending");
  auto pending = sessionFilesAwaitingUpload(*env.fileManager);
  ASSERT_EQ(pending.size(), 2u);
  // By creation date, although the names sort the other way.
  EXPECT_EQ(pending[0].path, second);
  EXPECT_EQ(pending[1].path, first);
  EXPECT_LT(pending[0].attributes.creationDate, pending[1].attributes.creationDate);
}

}  // namespace
}  // namespace fbf::testing
