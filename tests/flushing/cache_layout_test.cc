#include "flushing/cache_fixture.h"

#include <sys/stat.h>

namespace fbf::testing {
namespace {

// Guards against: a state change that loses contents, overwrites another copy
// of the session, or keeps the upload suffix.
using SessionStateChange = CacheTest;

TEST_F(SessionStateChange, MovesToThePlainNameOfTheNewStateWithItsContents) {
  auto file = makeFile(cache(), sessionName(S::closed, 1), "payload");
  std::error_code error;
  auto moved = vireon_renameForStateChange(fm(), file, S::processing, error);
  ASSERT_TRUE(moved) << error.message();
  EXPECT_EQ(*moved, cache() / sessionName(S::processing, 1));
  EXPECT_FALSE(fs::exists(file));
  EXPECT_EQ(readFile(*moved), "payload");

  auto upload = session(S::processing, 2, ".pb.uploadPending");
  moved = vireon_renameForStateChange(fm(), upload, S::uploaded, error);
  ASSERT_TRUE(moved);
  EXPECT_EQ(moved->filename(), sessionName(S::uploaded, 2));
}

TEST_F(SessionStateChange, FailuresLeaveEverythingInPlaceAndSayWhy) {
  auto junk = makeFile(cache(), "session.junk");
  auto closed = makeFile(cache(), sessionName(S::closed, 2), "new");
  auto processing = makeFile(cache(), sessionName(S::processing, 2), "old");
  struct Row {
    const char* name;
    fs::path file;
    std::errc why;
  };
  const Row rows[] = {
      {"unparseable name", junk, std::errc::invalid_argument},
      {"missing file", cache() / sessionName(S::closed, 9), std::errc::no_such_file_or_directory},
      {"target exists", closed, std::errc::file_exists}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    std::error_code error;
    EXPECT_FALSE(vireon_renameForStateChange(fm(), row.file, S::processing, error));
    EXPECT_EQ(error, row.why);
  }
  EXPECT_TRUE(fs::exists(junk));
  EXPECT_EQ(readFile(closed), "new");
  EXPECT_EQ(readFile(processing), "old");
}

// Guards against: cache subdirectories readable by others, or one failure
// stopping the other from being made.
using CacheSubdirectories = CacheTest;

TEST_F(CacheSubdirectories, AreCreatedOrRepairedOwnerOnly) {
  fs::create_directories(cache() / "Cohorts");
  chmod((cache() / "Cohorts").c_str(), 0755);
  createRequiredCacheSubdirectories(fm());
  for (const char* name : {"CustomFeedback", "Cohorts"}) {
    auto attrs = fm().attributes(cache() / name);
    ASSERT_TRUE(attrs) << name;
    EXPECT_TRUE(attrs->isDirectory());
    EXPECT_EQ(attrs->mode, 0700u) << name;
  }
}

TEST_F(CacheSubdirectories, AFileInTheWayIsLoggedAndTheOtherIsStillMade) {
  makeFile(cache(), "CustomFeedback", "not a directory");
  createRequiredCacheSubdirectories(fm());
  EXPECT_TRUE(logs.contains("Error making vireond caches subdir: "));
  EXPECT_TRUE(fs::is_directory(cache() / "Cohorts"));
  EXPECT_TRUE(fs::is_regular_file(cache() / "CustomFeedback"));
}

TEST_F(CacheSubdirectories, WithoutACachesDirectoryNothingIsMadeOrWalked) {
  fs::remove_all(env.dirs.cacheHome);
  createRequiredCacheSubdirectories(fm());
  EXPECT_TRUE(logs.contains("unable to obtain cache directory"));
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_FALSE(FeedbackEnumerator::make(fm()));
  EXPECT_FALSE(fs::exists(env.dirs.cacheHome));
}

// Guards against: custom feedback written where it is never sent, readable by
// others, or outside its type directory.
using PersistingCustomFeedback = CacheTest;

TEST_F(PersistingCustomFeedback, RecordLandsInItsTypeDirectoryOwnerOnlyAndIsEnumerated) {
  auto path = persistCustomFeedback(fm(), "cohort bytes", 11, "cohort-1");
  ASSERT_TRUE(path);
  EXPECT_EQ(*path, cache() / "CustomFeedback" / "Usage" / "cohort-1");
  EXPECT_EQ(readFile(*path), "cohort bytes");
  EXPECT_EQ(fm().attributes(*path)->mode, 0600u);
  EXPECT_EQ(fm().attributes(path->parent_path())->mode, 0700u);
  auto files = walkAll(fm());
  ASSERT_EQ(files.size(), 1u);
  EXPECT_EQ(files[0].fileURL, *path);
  EXPECT_EQ(files[0].typeString(), "Usage");
}

TEST_F(PersistingCustomFeedback, UnknownTypesAndEscapingNamesAreRefused) {
  using namespace std::string_view_literals;
  struct Row {
    int type;
    std::string_view name;
  };
  const Row rows[] = {{0, "a"},    {14, "b"},          {99, "c"},    {2, ""sv},    {2, "."sv},
                      {2, ".."sv}, {2, "../escape"sv}, {2, "a/b"sv}, {2, "a\0b"sv}};
  fs::create_directories(cache() / "CustomFeedback");
  for (const auto& row : rows) {
    EXPECT_FALSE(persistCustomFeedback(fm(), "x", row.type, row.name)) << row.type << row.name;
  }
  EXPECT_EQ(logs.count("error persisting custom feedback at"), 9u);
  EXPECT_TRUE(logs.contains("error persisting custom feedback at " +
                            (cache() / "CustomFeedback" / "(unknown: 99)").string() + "/c"));
  EXPECT_EQ(entryNames(cache() / "CustomFeedback"), std::vector<std::string>{});
}

// Guards against: a failed removal going unlogged or reported as done.
TEST_F(CacheTest, AFailedRemovalIsLoggedWithTheCallersMessage) {
  auto file = makeFile(cache(), "x");
  EXPECT_TRUE(vireon_removeItemOrLogError(fm(), file, "Could not drop x"));
  EXPECT_FALSE(fs::exists(file));
  EXPECT_FALSE(vireon_removeItemOrLogError(fm(), file, "Could not drop x"));
  EXPECT_TRUE(logs.contains("Could not drop x: No such file or directory"));
}

// Guards against: uploads left pending retried newest first, or other files among them.
TEST_F(CacheTest, UploadsLeftPendingAreListedOldestFirst) {
  session(S::closed, 1);
  auto second = session(S::processing, 3, ".json.uploadPending");
  auto first = makeFileCreatedAfter(fm(), second, cache(),
                                    sessionName(S::processing, 2) + ".pb.uploadPending");
  auto pending = sessionFilesAwaitingUpload(fm());
  ASSERT_EQ(pending.size(), 2u);
  // By creation date, although the names sort the other way.
  EXPECT_EQ(pending[0].path, second);
  EXPECT_EQ(pending[1].path, first);
}

}  // namespace
}  // namespace fbf::testing
