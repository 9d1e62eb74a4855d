#include "flushing/flushing_test_util.h"

#include <sys/stat.h>

using namespace std::chrono_literals;

namespace fbf::testing {
namespace {

// Guards against: a state change that loses contents or overwrites another copy.
TEST_F(CacheTest, AStateChangeMovesToThePlainNameOfTheNewStateOrSaysWhyNot) {
  auto closed = makeFile(cache(), sessionName(S::closed, 1), "payload");
  auto upload = session(S::processing, 2, ".pb.uploadPending");
  std::error_code error;
  EXPECT_EQ(vireon_renameForStateChange(fm(), closed, S::processing, error),
            cache() / sessionName(S::processing, 1));
  EXPECT_EQ(readFile(cache() / sessionName(S::processing, 1)), "payload");
  EXPECT_EQ(vireon_renameForStateChange(fm(), upload, S::uploaded, error),
            cache() / sessionName(S::uploaded, 2));

  auto junk = makeFile(cache(), "session.junk");
  auto taken = makeFile(cache(), sessionName(S::closed, 1), "new");
  const std::pair<fs::path, std::errc> failures[] = {
      {junk, std::errc::invalid_argument},
      {cache() / sessionName(S::closed, 9), std::errc::no_such_file_or_directory},
      {taken, std::errc::file_exists}};
  for (const auto& [file, why] : failures) {
    EXPECT_FALSE(vireon_renameForStateChange(fm(), file, S::processing, error)) << file;
    EXPECT_EQ(error, why) << file;
  }
  EXPECT_TRUE(fs::exists(junk));
  EXPECT_EQ(readFile(taken), "new");
  EXPECT_EQ(readFile(cache() / sessionName(S::processing, 1)), "payload");
}

// Guards against: cache subdirectories readable by others, or not made at all.
TEST_F(CacheTest, RequiredSubdirectoriesAreMadeOrRepairedOwnerOnly) {
  fs::create_directories(cache() / "Cohorts");
  chmod((cache() / "Cohorts").c_str(), 0755);
  createRequiredCacheSubdirectories(fm());
  for (const char* name : {"CustomFeedback", "Cohorts"}) {
    EXPECT_EQ(fm().attributes(cache() / name).value().mode, 0700u) << name;
    EXPECT_TRUE(fm().attributes(cache() / name)->isDirectory()) << name;
  }
  fs::remove_all(cache());
  makeFile(cache(), "CustomFeedback", "not a directory");
  createRequiredCacheSubdirectories(fm());
  EXPECT_TRUE(logs.contains("Error making vireond caches subdir: "));
  EXPECT_TRUE(fs::is_directory(cache() / "Cohorts"));

  fs::remove_all(env.dirs.cacheHome);
  createRequiredCacheSubdirectories(fm());
  EXPECT_TRUE(logs.contains("unable to obtain cache directory"));
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_FALSE(FeedbackEnumerator::make(fm()));
  EXPECT_FALSE(fs::exists(env.dirs.cacheHome));
}

// Guards against: custom feedback written outside its type directory, or readable by others.
TEST_F(CacheTest, CustomFeedbackLandsOwnerOnlyInItsTypeDirectoryOrNowhere) {
  auto path = persistCustomFeedback(fm(), "cohort bytes", 11, "cohort-1");
  ASSERT_EQ(path, cache() / "CustomFeedback" / "Usage" / "cohort-1");
  EXPECT_EQ(readFile(*path), "cohort bytes");
  EXPECT_EQ(fm().attributes(*path)->mode, 0600u);
  EXPECT_EQ(fm().attributes(path->parent_path())->mode, 0700u);
  auto files = drain(FeedbackEnumerator::make(fm()));
  ASSERT_EQ(files.size(), 1u);
  EXPECT_EQ(files[0].fileURL, *path);

  using namespace std::string_view_literals;
  const std::pair<int, std::string_view> refused[] = {{0, "a"},         {14, "b"},  {99, "c"},
                                                      {2, ""},          {2, "."},   {2, ".."},
                                                      {2, "../escape"}, {2, "a/b"}, {2, "a\0b"sv}};
  for (const auto& [type, name] : refused) {
    EXPECT_FALSE(persistCustomFeedback(fm(), "x", type, name)) << type << name;
  }
  EXPECT_EQ(logs.count("error persisting custom feedback at"), 9u);
  EXPECT_EQ(entryNames(cache() / "CustomFeedback"), std::vector<std::string>{"Usage"});
  EXPECT_EQ(entryNames(cache() / "CustomFeedback" / "Usage"), std::vector<std::string>{"cohort-1"});
}

// Guards against: a failed removal unlogged, or pending uploads retried newest first.
TEST_F(CacheTest, RemovalFailuresAreLoggedAndPendingUploadsListedOldestFirst) {
  auto file = makeFile(cache(), "x");
  EXPECT_TRUE(vireon_removeItemOrLogError(fm(), file, "Could not drop x"));
  EXPECT_FALSE(vireon_removeItemOrLogError(fm(), file, "Could not drop x"));
  EXPECT_TRUE(logs.contains("Could not drop x: No such file or directory"));

  session(S::closed, 1);
  auto older = session(S::processing, 3, ".json.uploadPending");
  auto newer = makeFileCreatedAfter(fm(), older, cache(),
                                    sessionName(S::processing, 2) + ".pb.uploadPending");
  auto pending = sessionFilesAwaitingUpload(fm());
  ASSERT_EQ(pending.size(), 2u);
  EXPECT_EQ(pending[0].path, older);  // by creation date, though names sort the other way
  EXPECT_EQ(pending[1].path, newer);
}

// Guards against: a loss record with the wrong size or age, or one for an unknown type.
TEST_F(CacheTest, ALossRecordHasSizeInKibibytesRoundedUpAndAgeTruncated) {
  struct Row {
    size_t bytes;
    std::chrono::milliseconds after;
    int32_t type;
    std::optional<int64_t> size, age;
  };
  const Row rows[] = {{0, 5s, 2, 0, 5},           {1, 5s, 2, 1, 5},           {1024, 5s, 2, 1, 5},
                      {1025, 90900ms, 11, 2, 90}, {3073, -2500ms, 13, 4, -2}, {10, 0s, 1, 1, 0},
                      {10, 0s, 0, {}, {}},        {10, 0s, 14, {}, {}}};
  for (const auto& row : rows) {
    SCOPED_TRACE(::testing::Message() << row.bytes << " bytes, type " << row.type);
    auto file = makeFile(cache(), "f", std::string(row.bytes, 'b'));
    auto event = FeedbackDeletionEvent::make(file, row.type, FeedbackDeletionReason::tooLarge,
                                             creationDate(fm(), file) + row.after, fm());
    ASSERT_EQ(event.has_value(), row.size.has_value());
    if (!event) continue;
    EXPECT_EQ(event->size, *row.size);
    EXPECT_EQ(event->age, *row.age);
    EXPECT_EQ(event->feedbackType, row.type);
    EXPECT_EQ(event->reason, FeedbackDeletionReason::tooLarge);
  }
  EXPECT_FALSE(FeedbackDeletionEvent::make(cache() / "missing", 2, 1, env.clock->now(), fm()));
}

}  // namespace
}  // namespace fbf::testing
