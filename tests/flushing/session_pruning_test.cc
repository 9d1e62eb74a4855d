#include "assembly/fbf_strings.h"
#include "flushing/cache_fixture.h"

#include <set>

namespace fbf::testing {
namespace {

// Guards against: an overfull cache pruned at or below its limit, cut to the
// wrong size, the newest files dropped instead of the oldest, or files that are
// not sessions counted or removed.
// Files are made in the order of their UUIDs, so the oldest are also the first
// by name (creation times are coarse and often tie).
class OverfullSessionDirectory : public CacheTest {
 protected:
  std::vector<fs::path> fill(unsigned count) {
    std::vector<fs::path> files;
    for (unsigned i = 0; i < count; ++i)
      files.push_back(session(i % 3 ? S::processing : S::closed, i));
    return files;
  }
  // The oldest `removed` files are gone and every newer one is still there.
  void expectOldestRemoved(const std::vector<fs::path>& files, size_t removed) {
    for (size_t i = 0; i < files.size(); ++i) {
      EXPECT_EQ(fs::exists(files[i]), i >= removed) << files[i].filename();
    }
  }
};

TEST_F(OverfullSessionDirectory, AtTheLimitAllStayOnePastItHalfTheLimitRemains) {
  const int limit = FBFConstants::MaximumNumberOfFeedbackFiles;
  auto files = fill(100);
  std::vector<fs::path> others;
  for (unsigned i = 0; i < 5; ++i) {
    others.push_back(makeFile(cache(), "other-" + std::to_string(i)));
    others.push_back(
        makeFile(cache() / "CustomFeedback" / "Usage", sessionName(S::closed, 500 + i)));
  }
  EXPECT_TRUE(vireon_getPrunedSessionFiles(fm(), limit).empty());
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), limit), 0u);
  // Its name starts with "session", so it counts, and it is the newest.
  files.push_back(makeFile(cache(), "sessionjunk"));
  auto selected = vireon_getPrunedSessionFiles(fm(), limit);
  ASSERT_EQ(selected.size(), 51u);
  EXPECT_EQ(selected.front(), files.front());
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), limit), 51u);
  expectOldestRemoved(files, 51);
  for (const auto& f : others) EXPECT_TRUE(fs::exists(f)) << f;
}

TEST_F(OverfullSessionDirectory, OlderCreationDateWinsOverName) {
  auto files = fill(4);
  // The newest file by creation sorts first by name.
  auto newest = makeFileCreatedAfter(fm(), files.back(), cache(), "session.0.junk");
  auto selected = vireon_getPrunedSessionFiles(fm(), 2);
  EXPECT_EQ(std::set<fs::path>(selected.begin(), selected.end()),
            std::set<fs::path>(files.begin(), files.end()));
}

TEST_F(OverfullSessionDirectory, EachFileIsAnnouncedWhileItExistsAndAVanishedOneIsLogged) {
  auto files = fill(5);
  std::vector<fs::path> announced;
  size_t existedWhenAnnounced = 0;
  auto removed = vireon_pruneSessionFiles(fm(), 2, [&](const fs::path& file) {
    announced.push_back(file);
    existedWhenAnnounced += fs::exists(file);
    if (file == files[1]) fs::remove(file);  // another process got there first
  });
  EXPECT_EQ(announced, std::vector<fs::path>(files.begin(), files.begin() + 4));
  EXPECT_EQ(existedWhenAnnounced, 4u);
  EXPECT_EQ(removed, 3u);
  EXPECT_EQ(logs.count("error removing session file"), 1u);
  expectOldestRemoved(files, 4);
}

}  // namespace
}  // namespace fbf::testing
