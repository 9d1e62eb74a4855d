#include "flushing/cache_fixture.h"

#include <sys/stat.h>
#include <unistd.h>

#include <set>

using namespace std::chrono_literals;

namespace fbf::testing {
namespace {

// Forwards to the real file manager; its directory walks remove each entry
// named in `vanishing` right after listing it, as another process might.
class RacingFileManager final : public FileManager {
 public:
  explicit RacingFileManager(FileManager& real) : real_(real) {}
  std::set<std::string> vanishing;

  std::unique_ptr<DirectoryEnumerator> enumerate(const fs::path& dir) const override {
    struct Walk final : DirectoryEnumerator {
      std::unique_ptr<DirectoryEnumerator> inner;
      const std::set<std::string>& vanishing;
      Walk(std::unique_ptr<DirectoryEnumerator> i, const std::set<std::string>& v)
          : inner(std::move(i)), vanishing(v) {}
      std::optional<DirectoryEntry> next() override {
        auto e = inner->next();
        if (e && vanishing.count(e->name)) fs::remove(e->path);
        return e;
      }
    };
    auto inner = real_.enumerate(dir);
    return inner ? std::make_unique<Walk>(std::move(inner), vanishing) : nullptr;
  }
  std::optional<fs::path> cachesDirectory() const override { return real_.cachesDirectory(); }
  std::optional<FileAttributes> attributes(const fs::path& p, std::error_code* e) const override {
    return real_.attributes(p, e);
  }
  bool moveItem(const fs::path& a, const fs::path& b, std::error_code& e) override {
    return real_.moveItem(a, b, e);
  }
  bool removeItem(const fs::path& p, std::error_code& e) override { return real_.removeItem(p, e); }
  bool copyItem(const fs::path& a, const fs::path& b, std::error_code& e) override {
    return real_.copyItem(a, b, e);
  }
  bool createOrFixDirectory(const fs::path& d, std::error_code& e) override {
    return real_.createOrFixDirectory(d, e);
  }
  FileDescriptor openForReading(const fs::path& p, std::error_code& e) const override {
    return real_.openForReading(p, e);
  }
  FileDescriptor createForWriting(const fs::path& p, std::error_code& e) override {
    return real_.createForWriting(p, e);
  }
  std::optional<std::string> readFile(const fs::path& p, std::error_code& e) const override {
    return real_.readFile(p, e);
  }
  bool writeFileAtomically(const fs::path& p, std::string_view b, std::error_code& e) override {
    return real_.writeFileAtomically(p, b, e);
  }
  bool setOwnerOnlyProtection(const fs::path& p, std::error_code& e) override {
    return real_.setOwnerOnlyProtection(p, e);
  }

 private:
  FileManager& real_;
};

// Guards against: a link, FIFO, directory or another user's file in the cache
// being followed, opened, renamed or sent, and against odd names or files that
// vanish mid-walk derailing cleanup, pruning or the walk.
class HostileCacheEntries : public CacheTest {
 protected:
  static std::set<std::string> names(const std::vector<FeedbackFile>& files) {
    std::set<std::string> out;
    for (const auto& f : files) out.insert(f.fileName());
    return out;
  }
  void cleanupLater() {
    env.clock->advance(100 * 86400s);
    vireon_cleanup(fm(), env.clock->now());
  }
};

TEST_F(HostileCacheEntries, ALinkDisguisedAsAClosedSessionIsNeverFollowed) {
  auto secret = makeFile(env.temp.path(), "private-key", "secret");
  auto closedLink = cache() / sessionName(S::closed, 1);
  auto openLink = cache() / sessionName(S::open, 2);
  auto junkLink = cache() / "session.junk";
  for (const auto& link : {closedLink, openLink, junkLink}) fs::create_symlink(secret, link);
  fs::create_directories(cache() / "CustomFeedback");
  fs::create_directory_symlink(env.temp.path(), cache() / "CustomFeedback" / "UserReport");
  fs::create_symlink(secret, cache() / "CustomFeedback" / "Usage");
  auto besideSecret = entryNames(env.temp.path());

  cleanupLater();
  for (const auto& link : {closedLink, openLink, junkLink}) EXPECT_TRUE(fs::is_symlink(link));
  EXPECT_TRUE(walkAll(fm()).empty());
  EXPECT_TRUE(logs.contains("Feedback enumerator skipped " + closedLink.string()));

  std::error_code error;
  EXPECT_FALSE(vireon_renameForStateChange(fm(), closedLink, S::processing, error));
  EXPECT_EQ(error, std::errc::operation_not_permitted);
  EXPECT_TRUE(fs::is_symlink(closedLink));

  EXPECT_TRUE(vireon_getPrunedSessionFiles(fm(), 0).empty());
  EXPECT_EQ(readFile(secret), "secret");
  EXPECT_EQ(entryNames(env.temp.path()), besideSecret);  // nothing moved next to the secret
}

TEST_F(HostileCacheEntries, FifosAndDirectoriesWithSessionNamesAreLeftAlone) {
  auto fifo = cache() / sessionName(S::closed, 1);
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  auto dir = cache() / sessionName(S::open, 2);
  makeFile(dir, sessionName(S::closed, 3));
  auto junkDir = cache() / "session.junk";
  fs::create_directory(junkDir);
  auto customFifo = cache() / "CustomFeedback" / "Usage" / "record";
  fs::create_directories(customFifo.parent_path());
  ASSERT_EQ(mkfifo(customFifo.c_str(), 0600), 0);

  cleanupLater();
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 0), 0u);
  EXPECT_TRUE(walkAll(fm()).empty());  // would hang if a FIFO were opened
  EXPECT_TRUE(fs::is_fifo(fifo));
  EXPECT_TRUE(fs::is_directory(dir));
  EXPECT_TRUE(fs::is_directory(junkDir));
  EXPECT_TRUE(fs::is_fifo(customFifo));
  EXPECT_TRUE(logs.contains("Feedback enumerator skipped " + customFifo.string()));
}

TEST_F(HostileCacheEntries, FilesOfAnotherUserAreNeverYielded) {
  auto file = session(S::closed, 1);
  if (chown(file.c_str(), 65534, 65534) != 0) GTEST_SKIP() << "changing owners needs privileges";
  EXPECT_TRUE(walkAll(fm()).empty());
  EXPECT_TRUE(vireon_getPrunedSessionFiles(fm(), 0).empty());
  EXPECT_TRUE(fs::exists(file));
}

TEST_F(HostileCacheEntries, OddNamesAreParsedSafely) {
  std::string longSession = sessionName(S::closed, 1) + ".";
  longSession.append(255 - longSession.size(), 'z');
  std::string longCustom(255, 'c');
  auto usage = cache() / "CustomFeedback" / "Usage";
  makeFile(cache(), longSession);
  makeFile(cache(), sessionName(S::closed, 2) + " copy");
  makeFile(cache(), sessionName(S::closed, 3) + "\n");
  makeFile(cache(), "session.\xff\xfe." + uuidString(4) + ".closed");
  makeFile(cache(), "notes with spaces\nand a newline \xff.txt");
  makeFile(usage, longCustom);
  makeFile(usage, "report \n\xff.bin");

  vireon_cleanup(fm(), env.clock->now());
  // The three unparseable session names went; everything else stayed.
  EXPECT_EQ(entryNames(cache()),
            (std::vector<std::string>{"CustomFeedback", "notes with spaces\nand a newline \xff.txt",
                                      longSession}));
  EXPECT_EQ(names(walkAll(fm())),
            (std::set<std::string>{longSession, longCustom, "report \n\xff.bin"}));
}

TEST_F(HostileCacheEntries, FilesAndDirectoriesRemovedMidWalkAreNotYielded) {
  auto usage = cache() / "CustomFeedback" / "Usage";
  for (unsigned i = 0; i < 3; ++i) makeFile(usage, "u" + std::to_string(i));
  std::vector<fs::path> files;
  for (unsigned i = 0; i < 6; ++i) files.push_back(session(S::closed, i));

  // Custom feedback first, so the Usage walk is under way when it goes.
  auto e = FeedbackEnumerator::make(fm(), {}, [](size_t n) { return n - 1; });
  ASSERT_TRUE(e);
  auto first = e->next();
  ASSERT_TRUE(first);
  EXPECT_EQ(first->typeString(), "Usage");
  fs::remove_all(usage);
  for (unsigned i = 0; i < 6; i += 2) fs::remove(files[i]);

  auto rest = drain(*e);
  for (const auto& f : rest) EXPECT_TRUE(fs::exists(f.fileURL)) << f.fileURL;
  EXPECT_EQ(rest.size(), 3u);
}

TEST_F(HostileCacheEntries, CleanupGoesOnWhenFilesVanishBetweenListingAndAction) {
  RacingFileManager racing(fm());
  racing.vanishing = {sessionName(S::open, 1), "session.junk"};
  session(S::open, 1);
  makeFile(cache(), "session.junk");
  auto other = session(S::open, 2);
  auto otherJunk = makeFile(cache(), "session.junk2");
  env.clock->advance(100 * 86400s);
  vireon_cleanup(racing, env.clock->now());
  EXPECT_TRUE(logs.contains("error renaming session file"));
  EXPECT_TRUE(logs.contains("error removing session file"));
  EXPECT_FALSE(fs::exists(other));
  EXPECT_FALSE(fs::exists(otherJunk));
  EXPECT_EQ(entryNames(cache()), std::vector<std::string>{sessionName(S::closed, 2)});
}

}  // namespace
}  // namespace fbf::testing
