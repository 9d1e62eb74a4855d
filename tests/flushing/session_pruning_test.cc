#include "assembly/fbf_strings.h"
#include "flushing/cache_layout.h"
#include "flushing/flushing_test_util.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <set>

namespace fbf::testing {
namespace {

// A cache directory that filled up because nothing was uploaded for a while.
// Files are made in the order of their UUIDs, so the oldest are also the
// first by name (creation times are coarse and often tie).
class OverfullSessionDirectory : public ::testing::Test {
 protected:
  FileManager& fm() { return *env.fileManager; }
  std::vector<fs::path> fill(unsigned count) {
    std::vector<fs::path> files;
    for (unsigned i = 0; i < count; ++i) {
      auto state = i % 3 == 0 ? SessionFileState::closed : SessionFileState::processing;
      files.push_back(makeFile(env.cacheDir(), sessionName(state, i)));
    }
    return files;
  }
  size_t remaining(const std::vector<fs::path>& files) {
    size_t n = 0;
    for (const auto& f : files) n += fs::exists(f);
    return n;
  }
  // The oldest `removed` files are gone and every newer one is still there.
  void expectOldestRemoved(const std::vector<fs::path>& files, size_t removed) {
    for (size_t i = 0; i < files.size(); ++i) {
      EXPECT_EQ(fs::exists(files[i]), i >= removed) << files[i].filename();
    }
  }

  TestEnvironment env;
};

TEST_F(OverfullSessionDirectory, HundredFilesAtTheDefaultMaximumAreKept) {
  auto files = fill(100);
  EXPECT_TRUE(
      vireon_getPrunedSessionFiles(fm(), FBFConstants::MaximumNumberOfFeedbackFiles).empty());
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), FBFConstants::MaximumNumberOfFeedbackFiles), 0u);
  EXPECT_EQ(remaining(files), 100u);
}

TEST_F(OverfullSessionDirectory, HundredAndOneFilesAreCutToFifty) {
  auto files = fill(101);
  EXPECT_EQ(vireon_getPrunedSessionFiles(fm(), 100).size(), 51u);
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 100), 51u);
  expectOldestRemoved(files, 51);
}

TEST_F(OverfullSessionDirectory, ThousandFilesAtMaximumThousandAreKept) {
  auto files = fill(1000);
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 1000), 0u);
  EXPECT_EQ(remaining(files), 1000u);
}

TEST_F(OverfullSessionDirectory, ThousandAndOneFilesLoseThe501Oldest) {
  auto files = fill(1001);
  auto selected = vireon_getPrunedSessionFiles(fm(), 1000);
  ASSERT_EQ(selected.size(), 501u);
  EXPECT_EQ(selected.front(), files.front());
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 1000), 501u);
  expectOldestRemoved(files, 501);
}

TEST_F(OverfullSessionDirectory, OlderCreationDateWinsOverName) {
  auto files = fill(4);
  // The newest file by creation sorts first by name.
  auto newest = makeFileCreatedAfter(fm(), files.back(), env.cacheDir(), "session.0.junk");
  auto selected = vireon_getPrunedSessionFiles(fm(), 2);
  ASSERT_EQ(selected.size(), 4u);
  EXPECT_EQ(std::set<fs::path>(selected.begin(), selected.end()),
            std::set<fs::path>(files.begin(), files.end()));
  EXPECT_TRUE(std::find(selected.begin(), selected.end(), newest) == selected.end());
}

TEST_F(OverfullSessionDirectory, OnlySessionFilesAreCountedAndRemoved) {
  auto files = fill(100);
  std::vector<fs::path> others;
  for (unsigned i = 0; i < 30; ++i)
    others.push_back(makeFile(env.cacheDir(), "other-" + std::to_string(i)));
  fs::create_directories(env.cacheDir() / "CustomFeedback" / "Usage");
  for (unsigned i = 0; i < 30; ++i) {
    others.push_back(makeFile(env.cacheDir() / "CustomFeedback" / "Usage",
                              sessionName(SessionFileState::closed, 500 + i)));
  }
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 100), 0u);
  makeFile(env.cacheDir(), "sessionjunk");  // counts: its name starts with "session"
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 100), 51u);
  EXPECT_EQ(remaining(others), others.size());
}

TEST_F(OverfullSessionDirectory, EachFileIsAnnouncedWhileItStillExists) {
  auto files = fill(12);
  std::vector<fs::path> announced;
  size_t existedWhenAnnounced = 0;
  auto removed = vireon_pruneSessionFiles(fm(), 10, [&](const fs::path& file) {
    announced.push_back(file);
    existedWhenAnnounced += fs::exists(file);
  });
  EXPECT_EQ(removed, 7u);
  EXPECT_EQ(announced, std::vector<fs::path>(files.begin(), files.begin() + 7));
  EXPECT_EQ(existedWhenAnnounced, 7u);
}

TEST_F(OverfullSessionDirectory, AFileThatVanishesBeforeRemovalIsLoggedAndTheRestGoOn) {
  LogCapture logs;
  auto files = fill(5);
  auto removed = vireon_pruneSessionFiles(fm(), 2, [&](const fs::path& file) {
    if (file == files[1]) fs::remove(file);  // another process got there first
  });
  EXPECT_EQ(removed, 3u);
  EXPECT_EQ(logs.count("error removing session file"), 1u);
  expectOldestRemoved(files, 4);
}

}  // namespace
}  // namespace fbf::testing
