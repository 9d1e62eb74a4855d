#include "flushing/cache_layout.h"
#include "flushing/flushing_test_util.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

using namespace std::chrono_literals;

namespace fbf::testing {
namespace {

// A cache directory left behind by writers that may have crashed.
class CleanupAfterCrashedWriters : public ::testing::Test {
 protected:
  FileManager& fm() { return *env.fileManager; }
  fs::path session(SessionFileState state, unsigned n) {
    return makeFile(env.cacheDir(), sessionName(state, n));
  }
  // Runs cleanup with the clock set `age` after the file's creation.
  void cleanupAtAge(const fs::path& file, std::chrono::nanoseconds age) {
    env.clock->set(creationDate(fm(), file) +
                   std::chrono::duration_cast<SystemTime::duration>(age));
    vireon_cleanup(fm(), env.clock->now());
  }

  TestEnvironment env;
  LogCapture logs;
};

TEST_F(CleanupAfterCrashedWriters, OpenFileExactly1800SecondsOldStaysOpen) {
  auto file = session(SessionFileState::open, 1);
  cleanupAtAge(file, 1800s);
  EXPECT_TRUE(fs::exists(file));
  EXPECT_TRUE(logs.contains("Leaving open session file " + file.filename().string() + "."));
  EXPECT_TRUE(logs.contains("Cleaning up"));
}

TEST_F(CleanupAfterCrashedWriters, OpenFile1801SecondsOldBecomesClosed) {
  auto file = session(SessionFileState::open, 1);
  cleanupAtAge(file, 1801s);
  EXPECT_FALSE(fs::exists(file));
  EXPECT_TRUE(fs::exists(env.cacheDir() / sessionName(SessionFileState::closed, 1)));
  EXPECT_TRUE(logs.contains(
      "Moving possible orphaned open session file to closed: " + file.filename().string() + "."));
}

TEST_F(CleanupAfterCrashedWriters, AgeIsTruncatedToWholeSeconds) {
  auto file = session(SessionFileState::open, 1);
  cleanupAtAge(file, 1800s + 999ms);
  EXPECT_TRUE(fs::exists(file));
}

TEST_F(CleanupAfterCrashedWriters, OpenFileFromTheFutureStaysOpen) {
  auto file = session(SessionFileState::open, 1);
  cleanupAtAge(file, -10000s);
  EXPECT_TRUE(fs::exists(file));
  EXPECT_TRUE(logs.contains("Leaving open session file " + file.filename().string() + "."));
}

TEST_F(CleanupAfterCrashedWriters, ClosedUploadedAndProcessingFilesAreLeftAlone) {
  auto closed = session(SessionFileState::closed, 1);
  auto uploaded = session(SessionFileState::uploaded, 2);
  auto processing = session(SessionFileState::processing, 3);
  auto pending =
      makeFile(env.cacheDir(), sessionName(SessionFileState::processing, 4) + ".pb.uploadPending");
  cleanupAtAge(closed, 100 * 86400s);
  EXPECT_EQ(entryNames(env.cacheDir()),
            (std::vector<std::string>{closed.filename(), uploaded.filename(), processing.filename(),
                                      pending.filename()}));
  EXPECT_TRUE(logs.contains(
      "Closed session file is ready for processing: " + closed.filename().string() + "."));
  EXPECT_TRUE(logs.contains("Ignoring file in uploaded state, but you might want to delete it: " +
                            uploaded.filename().string() + "."));
  EXPECT_EQ(logs.count(processing.filename().string()), 0u);
}

TEST_F(CleanupAfterCrashedWriters, UnparseableSessionNamesAreRemovedAndNothingElseIsTouched) {
  auto junk = makeFile(env.cacheDir(), "session.junk");
  auto truncated = makeFile(env.cacheDir(), "session.12." + uuidString(1));
  auto glued = makeFile(env.cacheDir(), "sessionnotes");
  auto bag = makeFile(env.cacheDir(), "bag.plist");
  auto notes = makeFile(env.cacheDir(), "notes.txt");
  fs::create_directories(env.cacheDir() / "CustomFeedback" / "Usage");
  auto custom = makeFile(env.cacheDir() / "CustomFeedback" / "Usage", "session.junk");

  vireon_cleanup(fm(), env.clock->now());

  EXPECT_FALSE(fs::exists(junk));
  EXPECT_FALSE(fs::exists(truncated));
  EXPECT_FALSE(fs::exists(glued));
  EXPECT_TRUE(fs::exists(bag));
  EXPECT_TRUE(fs::exists(notes));
  EXPECT_TRUE(fs::exists(custom));
  EXPECT_TRUE(
      logs.contains("Unable to parse filename session.junk into a SessionFilename object."));
  EXPECT_TRUE(
      logs.contains("Unable to parse filename sessionnotes into a SessionFilename object."));
}

TEST_F(CleanupAfterCrashedWriters, ARenameThatWouldReplaceAClosedCopyIsRefused) {
  auto open = session(SessionFileState::open, 1);
  auto closed =
      makeFile(env.cacheDir(), sessionName(SessionFileState::closed, 1), "the other copy");
  cleanupAtAge(open, 3600s);
  EXPECT_TRUE(fs::exists(open));
  EXPECT_EQ(readFile(closed), "the other copy");
  EXPECT_TRUE(logs.contains("error renaming session file"));
}

TEST_F(CleanupAfterCrashedWriters, MissingCacheDirectoryIsNotAnError) {
  fs::remove_all(env.cacheDir());
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_FALSE(fs::exists(env.cacheDir()));
}

TEST_F(CleanupAfterCrashedWriters, ManyOrphansAreAllClosedInOnePass) {
  std::vector<fs::path> files;
  for (unsigned i = 0; i < 50; ++i) files.push_back(session(SessionFileState::open, i));
  cleanupAtAge(files.back(), 1801s);
  for (unsigned i = 0; i < 50; ++i) {
    EXPECT_FALSE(fs::exists(files[i]));
    EXPECT_TRUE(fs::exists(env.cacheDir() / sessionName(SessionFileState::closed, i)));
  }
}

}  // namespace
}  // namespace fbf::testing
