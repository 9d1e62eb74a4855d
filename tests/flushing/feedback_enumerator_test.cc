#include "flushing/flushing_test_util.h"

namespace fbf::testing {
namespace {

// Guards against: a file sent under the wrong type.
TEST(FeedbackFileClassification, SessionNamesWinThenCustomDirectoriesThenUnknown) {
  using T = FeedbackFileType;
  struct Row {
    std::string path;
    T type;
    std::string typeString;
    int known;
    bool pending = false;
  };
  const std::string custom = "/c/vireond/CustomFeedback/";
  const Row rows[] = {
      {"/c/vireond/" + sessionName(S::closed, 1), T::session, "FeedbackV2", 12},
      {"/c/" + sessionName(S::processing, 1) + ".pb.uploadPending", T::session, "FeedbackV2PB", 13,
       true},
      {custom + "UserReport/report-1", T::custom, "UserReport", 10},
      {custom + "Usage/u.uploadPending", T::custom, "Usage", 11, true},
      {custom + "Usage/" + sessionName(S::closed, 2), T::session, "FeedbackV2", 12},
      {"/c/vireond/notes.txt", T::unknown, "", 0},
      {custom + "usage/x", T::unknown, "", 0},  // type names are case-sensitive
  };
  for (const auto& row : rows) {
    FeedbackFile file(row.path);
    EXPECT_EQ(file.fileType, row.type) << row.path;
    EXPECT_EQ(file.sessionFilename.has_value(), row.type == T::session) << row.path;
    EXPECT_EQ(file.typeString(), row.typeString) << row.path;
    EXPECT_EQ(file.knownFeedbackType(), row.known) << row.path;
    EXPECT_EQ(file.uploadPending(), row.pending) << row.path;
  }
}

// Guards against: a walk that misses, repeats or invents files, or never interleaves.
class FeedbackWalk : public CacheTest {
 protected:
  fs::path custom(std::string_view type) { return cache() / "CustomFeedback" / std::string(type); }
  void populate() {
    for (unsigned i = 0; i < 6; ++i) sessions.insert(session(S::closed, i));
    sessions.insert(session(S::processing, 99, ".pb.uploadPending"));
    for (std::string_view type : {"Usage", "UserReport", "Crowdsourcing"}) {
      for (unsigned i = 0; i < 2; ++i)
        customs.insert(makeFile(custom(type), "r" + std::to_string(i)));
    }
    for (const char* name : {"bag.plist", "notes.txt", "CustomFeedback/loose-file",
                             "CustomFeedback/NotAType/record", "Cohorts/cohorts.sqlite"}) {
      makeFile(cache(), name);
    }
  }
  std::vector<FeedbackFile> walk(std::vector<std::string> filter = {}, RandomChoice choose = {}) {
    return drain(choose ? FeedbackEnumerator::make(env.assembly(), filter, choose)
                        : FeedbackEnumerator::make(env.assembly(), filter));
  }
  // The kinds in the order walked: 's' for a session, 'c' for custom feedback.
  static std::string kinds(const std::vector<FeedbackFile>& files) {
    std::string out;
    for (const auto& f : files) out += f.fileType == FeedbackFileType::session ? 's' : 'c';
    return out;
  }

  std::set<fs::path> sessions, customs;
};

TEST_F(FeedbackWalk, EachCallDrawsAmongTheDirectoriesStillOpen) {
  populate();
  std::vector<size_t> counts;
  // Always the first: the cache directory is walked to its end first.
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
  // A type filter walks only those custom directories.
  std::multiset<std::string> types;
  for (const auto& f : walk({"Usage", "UserReport"})) types.insert(f.typeString());
  EXPECT_EQ(types, (std::multiset<std::string>{"Usage", "Usage", "UserReport", "UserReport"}));
  EXPECT_TRUE(walk({"NotAType", "usage"}).empty());
}

TEST_F(FeedbackWalk, FilesAndDirectoriesRemovedMidWalkAreNotYielded) {
  for (unsigned i = 0; i < 3; ++i) makeFile(custom("Usage"), "u" + std::to_string(i));
  std::vector<fs::path> files;
  for (unsigned i = 0; i < 6; ++i) files.push_back(session(S::closed, i));
  // Custom feedback first, so the Usage walk is under way when it goes.
  auto e = FeedbackEnumerator::make(fm(), {}, [](size_t n) { return n - 1; });
  ASSERT_TRUE(e);
  ASSERT_EQ(e->next().value().typeString(), "Usage");
  fs::remove_all(custom("Usage"));
  for (unsigned i = 0; i < 6; i += 2) fs::remove(files[i]);
  auto rest = drain(std::move(e));
  for (const auto& f : rest) EXPECT_TRUE(fs::exists(f.fileURL)) << f.fileURL;
  EXPECT_EQ(rest.size(), 3u);
}

}  // namespace
}  // namespace fbf::testing
