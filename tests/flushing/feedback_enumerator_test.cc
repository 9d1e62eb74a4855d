#include "flushing/feedback_enumerator.h"
#include "flushing/flushing_test_util.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <map>
#include <set>

namespace fbf::testing {
namespace {

TEST(FeedbackFileClassification, SessionNamesWinThenCustomDirectoriesThenUnknown) {
  FeedbackFile session("/c/vireond/" + sessionName(SessionFileState::closed, 1));
  EXPECT_EQ(session.fileType, FeedbackFileType::session);
  ASSERT_TRUE(session.sessionFilename);
  EXPECT_EQ(session.sessionFilename->state, SessionFileState::closed);
  EXPECT_EQ(session.typeString(), "FeedbackV2");
  EXPECT_EQ(session.knownFeedbackType(), 12);
  EXPECT_FALSE(session.uploadPending());
  EXPECT_EQ(session.enclosingDirectory(), "vireond");

  FeedbackFile pending("/c/vireond/" + sessionName(SessionFileState::processing, 1) +
                       ".pb.uploadPending");
  EXPECT_EQ(pending.typeString(), "FeedbackV2PB");
  EXPECT_EQ(pending.knownFeedbackType(), 13);
  EXPECT_TRUE(pending.uploadPending());

  FeedbackFile custom("/c/vireond/CustomFeedback/UserReport/report-1");
  EXPECT_EQ(custom.fileType, FeedbackFileType::custom);
  EXPECT_FALSE(custom.sessionFilename);
  EXPECT_EQ(custom.typeString(), "UserReport");
  EXPECT_EQ(custom.knownFeedbackType(), 10);
  EXPECT_EQ(custom.fileName(), "report-1");

  FeedbackFile sessionInCustom("/c/vireond/CustomFeedback/Usage/" +
                               sessionName(SessionFileState::closed, 2));
  EXPECT_EQ(sessionInCustom.fileType, FeedbackFileType::session);

  FeedbackFile unknown("/c/vireond/notes.txt");
  EXPECT_EQ(unknown.fileType, FeedbackFileType::unknown);
  EXPECT_EQ(unknown.typeString(), "");
  EXPECT_EQ(unknown.knownFeedbackType(), 0);

  EXPECT_EQ(FeedbackFile("/c/vireond/CustomFeedback/usage/x").fileType, FeedbackFileType::unknown);
}

// A cache directory holding session files, custom feedback of a few types
// and the usual bystanders.
class FeedbackWalk : public ::testing::Test {
 protected:
  fs::path custom(std::string_view type) {
    return env.cacheDir() / "CustomFeedback" / std::string(type);
  }
  void populate() {
    for (unsigned i = 0; i < 20; ++i)
      sessions.insert(makeFile(env.cacheDir(), sessionName(SessionFileState::closed, i)));
    sessions.insert(makeFile(env.cacheDir(),
                             sessionName(SessionFileState::processing, 99) + ".pb.uploadPending"));
    for (std::string_view type : {"Usage", "UserReport", "Crowdsourcing"}) {
      for (unsigned i = 0; i < 5; ++i)
        customs.insert(makeFile(custom(type), "record-" + std::to_string(i)));
    }
    makeFile(env.cacheDir(), "bag.plist");
    makeFile(env.cacheDir(), "notes.txt");
    makeFile(env.cacheDir() / "CustomFeedback", "loose-file");
    makeFile(env.cacheDir() / "CustomFeedback" / "NotAType", "record");
    makeFile(env.cacheDir() / "Cohorts", "cohorts.sqlite");
  }
  std::vector<FeedbackFile> drain(FeedbackEnumerator& e) {
    std::vector<FeedbackFile> out;
    while (auto f = e.next()) out.push_back(std::move(*f));
    return out;
  }
  static std::multiset<fs::path> paths(const std::vector<FeedbackFile>& files) {
    std::multiset<fs::path> out;
    for (const auto& f : files) out.insert(f.fileURL);
    return out;
  }

  TestEnvironment env;
  LogCapture logs;
  std::set<fs::path> sessions;
  std::set<fs::path> customs;
};

TEST_F(FeedbackWalk, YieldsEverySessionAndCustomFileExactlyOnce) {
  populate();
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  auto files = drain(*e);
  std::multiset<fs::path> expected(sessions.begin(), sessions.end());
  expected.insert(customs.begin(), customs.end());
  EXPECT_EQ(paths(files), expected);
  for (const auto& f : files) {
    EXPECT_EQ(f.fileType,
              sessions.count(f.fileURL) ? FeedbackFileType::session : FeedbackFileType::custom);
    ASSERT_TRUE(f.attributes);
    EXPECT_EQ(f.attributes->size, 1u);
  }
  EXPECT_TRUE(
      logs.contains("Feedback enumerator found " + (custom("Usage") / "record-0").string()));
}

TEST_F(FeedbackWalk, BystandersAreSkippedWithAMessageAndLeftInPlace) {
  populate();
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  drain(*e);
  EXPECT_TRUE(
      logs.contains("Feedback enumerator skipped " + (env.cacheDir() / "notes.txt").string()));
  EXPECT_TRUE(
      logs.contains("Feedback enumerator skipped " + (env.cacheDir() / "bag.plist").string()));
  EXPECT_TRUE(fs::exists(env.cacheDir() / "notes.txt"));
  EXPECT_TRUE(fs::exists(env.cacheDir() / "CustomFeedback" / "NotAType" / "record"));
  EXPECT_EQ(logs.count("NotAType"), 0u);
  EXPECT_EQ(logs.count("cohorts.sqlite"), 0u);
}

TEST_F(FeedbackWalk, OnceExhaustedItStaysExhausted) {
  populate();
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  drain(*e);
  EXPECT_EQ(e->pendingDirectoryCount(), 0u);
  for (int i = 0; i < 3; ++i) EXPECT_FALSE(e->next());
}

TEST_F(FeedbackWalk, EmptyCacheYieldsNothing) {
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  EXPECT_FALSE(e->next());
}

TEST_F(FeedbackWalk, FinishingEarlyEndsTheWalk) {
  populate();
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  ASSERT_TRUE(e->next());
  e->finish();
  EXPECT_FALSE(e->next());
}

TEST_F(FeedbackWalk, NoEnumeratorWithoutACachesDirectory) {
  fs::remove_all(env.dirs.cacheHome);
  EXPECT_FALSE(FeedbackEnumerator::make(env.assembly()));
}

TEST_F(FeedbackWalk, EachCallDrawsAmongTheDirectoriesStillOpen) {
  populate();
  std::vector<size_t> counts;
  // Always the first directory: the cache directory is walked to its end
  // before any custom feedback directory.
  auto first = FeedbackEnumerator::make(env.assembly(), {}, [&](size_t n) {
    counts.push_back(n);
    return size_t{0};
  });
  ASSERT_TRUE(first);
  auto files = drain(*first);
  ASSERT_EQ(files.size(), sessions.size() + customs.size());
  for (size_t i = 0; i < files.size(); ++i) {
    EXPECT_EQ(files[i].fileType,
              i < sessions.size() ? FeedbackFileType::session : FeedbackFileType::custom);
  }
  // Every directory is in the first draw (13 custom directories, 3 of them
  // present, and the cache directory); the count shrinks as walks end.
  ASSERT_FALSE(counts.empty());
  EXPECT_EQ(counts.front(), 4u);
  EXPECT_TRUE(std::is_sorted(counts.rbegin(), counts.rend()));

  // Always the last: custom feedback first.
  auto last = FeedbackEnumerator::make(env.assembly(), {}, [](size_t n) { return n - 1; });
  ASSERT_TRUE(last);
  files = drain(*last);
  ASSERT_EQ(files.size(), sessions.size() + customs.size());
  for (size_t i = 0; i < files.size(); ++i) {
    EXPECT_EQ(files[i].fileType,
              i < customs.size() ? FeedbackFileType::custom : FeedbackFileType::session);
  }
}

TEST_F(FeedbackWalk, TheSystemDrawInterleavesDirectories) {
  // With two directories of 200 files each, keeping one directory's files
  // together by chance has a probability of 2^-199.
  for (unsigned i = 0; i < 200; ++i) {
    makeFile(env.cacheDir(), sessionName(SessionFileState::closed, i));
    makeFile(custom("Usage"), "r" + std::to_string(i));
  }
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  auto files = drain(*e);
  ASSERT_EQ(files.size(), 400u);
  size_t switches = 0;
  for (size_t i = 1; i < files.size(); ++i) switches += files[i].fileType != files[i - 1].fileType;
  EXPECT_GT(switches, 1u);
}

TEST_F(FeedbackWalk, ATypeFilterWalksOnlyThoseCustomDirectories) {
  populate();
  auto e = FeedbackEnumerator::make(env.assembly(), {"Usage", "UserReport"});
  ASSERT_TRUE(e);
  auto files = drain(*e);
  ASSERT_EQ(files.size(), 10u);
  for (const auto& f : files) {
    EXPECT_EQ(f.fileType, FeedbackFileType::custom);
    EXPECT_TRUE(f.typeString() == "Usage" || f.typeString() == "UserReport") << f.typeString();
  }
  EXPECT_EQ(e->typeFilter(), (std::vector<std::string>{"Usage", "UserReport"}));
}

TEST_F(FeedbackWalk, AFilterOfUnknownTypesFindsNothing) {
  populate();
  auto e = FeedbackEnumerator::make(env.assembly(), {"NotAType", "usage"});
  ASSERT_TRUE(e);
  EXPECT_FALSE(e->next());
}

}  // namespace
}  // namespace fbf::testing
