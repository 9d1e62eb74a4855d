#include "flushing/cache_fixture.h"

#include <set>

namespace fbf::testing {
namespace {

// Guards against: a file sent under the wrong type, or a session file inside a
// custom directory taken for custom feedback.
TEST(FeedbackFileClassification, SessionNamesWinThenCustomDirectoriesThenUnknown) {
  struct Row {
    const char* name;
    std::string path;
    FeedbackFileType type;
    std::string typeString;
    int known;
    bool pending = false;
  };
  const Row rows[] = {
      {"closed session", "/c/vireond/" + sessionName(S::closed, 1), FeedbackFileType::session,
       "FeedbackV2", 12},
      {"protobuf upload", "/c/vireond/" + sessionName(S::processing, 1) + ".pb.uploadPending",
       FeedbackFileType::session, "FeedbackV2PB", 13, true},
      {"custom report", "/c/vireond/CustomFeedback/UserReport/report-1", FeedbackFileType::custom,
       "UserReport", 10},
      {"custom upload", "/c/vireond/CustomFeedback/Usage/u.uploadPending", FeedbackFileType::custom,
       "Usage", 11, true},
      {"session in a custom directory",
       "/c/vireond/CustomFeedback/Usage/" + sessionName(S::closed, 2), FeedbackFileType::session,
       "FeedbackV2", 12},
      {"bystander", "/c/vireond/notes.txt", FeedbackFileType::unknown, "", 0},
      {"type names are case-sensitive", "/c/vireond/CustomFeedback/usage/x",
       FeedbackFileType::unknown, "", 0},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    FeedbackFile file(row.path);
    EXPECT_EQ(file.fileType, row.type);
    EXPECT_EQ(file.sessionFilename.has_value(), row.type == FeedbackFileType::session);
    EXPECT_EQ(file.typeString(), row.typeString);
    EXPECT_EQ(file.knownFeedbackType(), row.known);
    EXPECT_EQ(file.uploadPending(), row.pending);
    EXPECT_EQ(file.fileName(), fs::path(row.path).filename());
  }
  EXPECT_EQ(FeedbackFile("/c/vireond/x").enclosingDirectory(), "vireond");
}

// Guards against: a walk that misses, repeats or invents feedback files, reads
// bystanders, keeps going after its end, or keeps one directory's files together.
// The cache holds session files, custom feedback of a few types and the usual
// bystanders.
class FeedbackWalk : public CacheTest {
 protected:
  fs::path custom(std::string_view type) { return cache() / "CustomFeedback" / std::string(type); }
  void populate() {
    for (unsigned i = 0; i < 6; ++i) sessions.insert(session(S::closed, i));
    sessions.insert(session(S::processing, 99, ".pb.uploadPending"));
    for (std::string_view type : {"Usage", "UserReport", "Crowdsourcing"}) {
      for (unsigned i = 0; i < 2; ++i)
        customs.insert(makeFile(custom(type), "record-" + std::to_string(i)));
    }
    makeFile(cache(), "bag.plist");
    makeFile(cache(), "notes.txt");
    makeFile(cache() / "CustomFeedback", "loose-file");
    makeFile(custom("NotAType"), "record");
    makeFile(cache() / "Cohorts", "cohorts.sqlite");
  }
  std::vector<FeedbackFile> walk(std::vector<std::string> filter = {}, RandomChoice choose = {}) {
    auto e = choose ? FeedbackEnumerator::make(env.assembly(), filter, choose)
                    : FeedbackEnumerator::make(env.assembly(), filter);
    if (!e) ADD_FAILURE() << "no enumerator";
    return e ? drain(*e) : std::vector<FeedbackFile>{};
  }
  // The types in the order walked, sessions marked 's' and custom files 'c'.
  static std::string kinds(const std::vector<FeedbackFile>& files) {
    std::string out;
    for (const auto& f : files) out += f.fileType == FeedbackFileType::session ? 's' : 'c';
    return out;
  }

  std::set<fs::path> sessions;
  std::set<fs::path> customs;
};

TEST_F(FeedbackWalk, YieldsEverySessionAndCustomFileOnceAndSkipsBystanders) {
  populate();
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  auto files = drain(*e);
  std::multiset<fs::path> found, expected(sessions.begin(), sessions.end());
  expected.insert(customs.begin(), customs.end());
  for (const auto& f : files) {
    found.insert(f.fileURL);
    EXPECT_EQ(f.fileType,
              sessions.count(f.fileURL) ? FeedbackFileType::session : FeedbackFileType::custom);
    ASSERT_TRUE(f.attributes);
    EXPECT_EQ(f.attributes->size, 1u);
  }
  EXPECT_EQ(found, expected);
  EXPECT_EQ(e->pendingDirectoryCount(), 0u);
  for (int i = 0; i < 2; ++i) EXPECT_FALSE(e->next());

  EXPECT_TRUE(
      logs.contains("Feedback enumerator found " + (custom("Usage") / "record-0").string()));
  for (const char* bystander : {"notes.txt", "bag.plist"}) {
    EXPECT_TRUE(logs.contains("Feedback enumerator skipped " + (cache() / bystander).string()));
    EXPECT_TRUE(fs::exists(cache() / bystander));
  }
  EXPECT_TRUE(fs::exists(custom("NotAType") / "record"));
  EXPECT_EQ(logs.count("NotAType"), 0u);
  EXPECT_EQ(logs.count("cohorts.sqlite"), 0u);
}

TEST_F(FeedbackWalk, AnEmptyOrFinishedWalkYieldsNothing) {
  auto empty = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(empty);
  EXPECT_FALSE(empty->next());
  populate();
  auto e = FeedbackEnumerator::make(env.assembly());
  ASSERT_TRUE(e);
  ASSERT_TRUE(e->next());
  e->finish();
  EXPECT_FALSE(e->next());
}

TEST_F(FeedbackWalk, EachCallDrawsAmongTheDirectoriesStillOpen) {
  populate();
  std::vector<size_t> counts;
  // Always the first directory: the cache directory is walked to its end
  // before any custom feedback directory.
  auto first = walk({}, [&](size_t n) {
    counts.push_back(n);
    return size_t{0};
  });
  EXPECT_EQ(kinds(first), std::string(sessions.size(), 's') + std::string(customs.size(), 'c'));
  // Every directory present is in the first draw (the cache directory and
  // three custom ones); the count shrinks as walks end.
  ASSERT_FALSE(counts.empty());
  EXPECT_EQ(counts.front(), 4u);
  EXPECT_TRUE(std::is_sorted(counts.rbegin(), counts.rend()));
  EXPECT_EQ(counts.back(), 2u);

  // Always the last: custom feedback first.
  EXPECT_EQ(kinds(walk({}, [](size_t n) { return n - 1; })),
            std::string(customs.size(), 'c') + std::string(sessions.size(), 's'));
}

TEST_F(FeedbackWalk, TheSystemDrawInterleavesDirectories) {
  // With two directories of 40 files each, keeping one directory's files
  // together by chance has a probability of 2^-39.
  for (unsigned i = 0; i < 40; ++i) {
    session(S::closed, i);
    makeFile(custom("Usage"), "r" + std::to_string(i));
  }
  auto files = walk();
  ASSERT_EQ(files.size(), 80u);
  std::string order = kinds(files);
  EXPECT_NE(order, std::string(40, 's') + std::string(40, 'c'));
  EXPECT_NE(order, std::string(40, 'c') + std::string(40, 's'));
}

TEST_F(FeedbackWalk, ATypeFilterWalksOnlyThoseCustomDirectories) {
  populate();
  std::multiset<std::string> types;
  for (const auto& f : walk({"Usage", "UserReport"})) types.insert(f.typeString());
  EXPECT_EQ(types, (std::multiset<std::string>{"Usage", "Usage", "UserReport", "UserReport"}));
  EXPECT_TRUE(walk({"NotAType", "usage"}).empty());
}

}  // namespace
}  // namespace fbf::testing
