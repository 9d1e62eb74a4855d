#include "flushing/cache_layout.h"
#include "flushing/feedback_enumerator.h"
#include "flushing/flushing_test_util.h"
#include "support/test_support.h"

#include <gtest/gtest.h>
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

  std::optional<fs::path> cachesDirectory() const override { return real_.cachesDirectory(); }
  std::optional<FileAttributes> attributes(const fs::path& p, std::error_code* e) const override {
    return real_.attributes(p, e);
  }
  std::unique_ptr<DirectoryEnumerator> enumerate(const fs::path& dir) const override {
    class Walk final : public DirectoryEnumerator {
     public:
      Walk(std::unique_ptr<DirectoryEnumerator> inner, const std::set<std::string>& vanishing)
          : inner_(std::move(inner)), vanishing_(vanishing) {}
      std::optional<DirectoryEntry> next() override {
        auto e = inner_->next();
        if (e && vanishing_.count(e->name)) fs::remove(e->path);
        return e;
      }

     private:
      std::unique_ptr<DirectoryEnumerator> inner_;
      const std::set<std::string>& vanishing_;
    };
    auto inner = real_.enumerate(dir);
    if (!inner) return nullptr;
    return std::make_unique<Walk>(std::move(inner), vanishing);
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

class HostileCacheEntries : public ::testing::Test {
 protected:
  FileManager& fm() { return *env.fileManager; }
  std::vector<FeedbackFile> walkAll(const FileManager& manager) {
    std::vector<FeedbackFile> out;
    auto e = FeedbackEnumerator::make(manager);
    if (!e) ADD_FAILURE() << "no enumerator";
    while (e) {
      auto f = e->next();
      if (!f) break;
      out.push_back(std::move(*f));
    }
    return out;
  }
  static std::set<std::string> names(const std::vector<FeedbackFile>& files) {
    std::set<std::string> out;
    for (const auto& f : files) out.insert(f.fileName());
    return out;
  }
  void ageEverything() { env.clock->advance(100 * 86400s); }

  TestEnvironment env;
  LogCapture logs;
};

TEST_F(HostileCacheEntries, ALinkDisguisedAsAClosedSessionIsNeverFollowed) {
  auto secret = makeFile(env.temp.path(), "private-key", "secret");
  auto closedLink = env.cacheDir() / sessionName(SessionFileState::closed, 1);
  auto openLink = env.cacheDir() / sessionName(SessionFileState::open, 2);
  auto junkLink = env.cacheDir() / "session.junk";
  fs::create_symlink(secret, closedLink);
  fs::create_symlink(secret, openLink);
  fs::create_symlink(secret, junkLink);
  fs::create_directories(env.cacheDir() / "CustomFeedback");
  fs::create_directory_symlink(env.temp.path(), env.cacheDir() / "CustomFeedback" / "UserReport");
  fs::create_symlink(secret, env.cacheDir() / "CustomFeedback" / "Usage");

  auto besideSecret = entryNames(env.temp.path());

  ageEverything();
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_TRUE(fs::is_symlink(closedLink));
  EXPECT_TRUE(fs::is_symlink(openLink));
  EXPECT_TRUE(fs::is_symlink(junkLink));

  EXPECT_TRUE(walkAll(fm()).empty());
  EXPECT_TRUE(logs.contains("Feedback enumerator skipped " + closedLink.string()));

  std::error_code error;
  EXPECT_FALSE(vireon_renameForStateChange(fm(), closedLink, SessionFileState::processing, error));
  EXPECT_EQ(error, std::errc::operation_not_permitted);
  EXPECT_TRUE(fs::is_symlink(closedLink));

  EXPECT_TRUE(vireon_getPrunedSessionFiles(fm(), 0).empty());
  EXPECT_EQ(readFile(secret), "secret");
  EXPECT_EQ(entryNames(env.temp.path()), besideSecret);  // nothing moved next to the secret
}

TEST_F(HostileCacheEntries, FifosAndDirectoriesWithSessionNamesAreLeftAlone) {
  auto fifo = env.cacheDir() / sessionName(SessionFileState::closed, 1);
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  auto dir = env.cacheDir() / sessionName(SessionFileState::open, 2);
  fs::create_directory(dir);
  makeFile(dir, sessionName(SessionFileState::closed, 3));
  auto junkDir = env.cacheDir() / "session.junk";
  fs::create_directory(junkDir);
  auto customFifo = env.cacheDir() / "CustomFeedback" / "Usage" / "record";
  fs::create_directories(customFifo.parent_path());
  ASSERT_EQ(mkfifo(customFifo.c_str(), 0600), 0);

  ageEverything();
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 0), 0u);
  EXPECT_TRUE(walkAll(fm()).empty());  // would hang if a FIFO were opened
  EXPECT_TRUE(fs::is_fifo(fifo));
  EXPECT_TRUE(fs::is_directory(dir));
  EXPECT_TRUE(fs::is_directory(junkDir));
  EXPECT_TRUE(fs::is_fifo(customFifo));
  EXPECT_TRUE(logs.contains("Feedback enumerator skipped " + customFifo.string()));
}

TEST_F(HostileCacheEntries, FilesOfAnotherUserAreNeverYielded) {
  auto file = makeFile(env.cacheDir(), sessionName(SessionFileState::closed, 1));
  if (chown(file.c_str(), 65534, 65534) != 0) GTEST_SKIP() << "changing owners needs privileges";
  EXPECT_TRUE(walkAll(fm()).empty());
  EXPECT_TRUE(vireon_getPrunedSessionFiles(fm(), 0).empty());
  EXPECT_TRUE(fs::exists(file));
}

TEST_F(HostileCacheEntries, OddNamesAreParsedSafely) {
  std::string longSession = sessionName(SessionFileState::closed, 1) + ".";
  longSession.append(255 - longSession.size(), 'z');
  std::string longCustom(255, 'c');
  auto usage = env.cacheDir() / "CustomFeedback" / "Usage";
  makeFile(env.cacheDir(), longSession);
  makeFile(env.cacheDir(), sessionName(SessionFileState::closed, 2) + " copy");
  makeFile(env.cacheDir(), sessionName(SessionFileState::closed, 3) + "\n");
  makeFile(env.cacheDir(), "session.\xff\xfe." + uuidString(4) + ".closed");
  makeFile(env.cacheDir(), "notes with spaces\nand a newline \xff.txt");
  makeFile(usage, longCustom);
  makeFile(usage, "report \n\xff.bin");

  vireon_cleanup(fm(), env.clock->now());
  // The three unparseable session names went; everything else stayed.
  EXPECT_EQ(entryNames(env.cacheDir()),
            (std::vector<std::string>{"CustomFeedback", "notes with spaces\nand a newline \xff.txt",
                                      longSession}));

  auto files = walkAll(fm());
  EXPECT_EQ(names(files), (std::set<std::string>{longSession, longCustom, "report \n\xff.bin"}));
  EXPECT_TRUE(fs::exists(usage / "report \n\xff.bin"));
}

TEST_F(HostileCacheEntries, ADirectoryRemovedMidWalkEndsItsWalkQuietly) {
  auto usage = env.cacheDir() / "CustomFeedback" / "Usage";
  for (unsigned i = 0; i < 50; ++i) makeFile(usage, "u" + std::to_string(i));
  for (unsigned i = 0; i < 5; ++i)
    makeFile(env.cacheDir(), sessionName(SessionFileState::closed, i));

  // Custom feedback first, so the Usage walk is under way when it goes.
  auto e = FeedbackEnumerator::make(fm(), {}, [](size_t n) { return n - 1; });
  ASSERT_TRUE(e);
  auto first = e->next();
  ASSERT_TRUE(first);
  EXPECT_EQ(first->typeString(), "Usage");
  fs::remove_all(usage);

  size_t sessions = 0;
  while (auto f = e->next()) {
    EXPECT_TRUE(fs::exists(f->fileURL)) << f->fileURL;
    sessions += f->fileType == FeedbackFileType::session;
  }
  EXPECT_EQ(sessions, 5u);
}

TEST_F(HostileCacheEntries, FilesRemovedAfterTheWalkStartedAreNotYielded) {
  std::vector<fs::path> files;
  for (unsigned i = 0; i < 40; ++i)
    files.push_back(makeFile(env.cacheDir(), sessionName(SessionFileState::closed, i)));
  auto e = FeedbackEnumerator::make(fm());
  ASSERT_TRUE(e);
  for (unsigned i = 0; i < 40; i += 2) fs::remove(files[i]);
  size_t yielded = 0;
  while (auto f = e->next()) {
    EXPECT_TRUE(fs::exists(f->fileURL)) << f->fileURL;
    ++yielded;
  }
  EXPECT_EQ(yielded, 20u);
}

TEST_F(HostileCacheEntries, CleanupGoesOnWhenAFileVanishesBetweenListingAndRename) {
  RacingFileManager racing(fm());
  auto gone = sessionName(SessionFileState::open, 1);
  racing.vanishing.insert(gone);
  makeFile(env.cacheDir(), gone);
  auto other = makeFile(env.cacheDir(), sessionName(SessionFileState::open, 2));
  ageEverything();
  vireon_cleanup(racing, env.clock->now());
  EXPECT_TRUE(logs.contains("error renaming session file"));
  EXPECT_FALSE(fs::exists(other));
  EXPECT_TRUE(fs::exists(env.cacheDir() / sessionName(SessionFileState::closed, 2)));
  EXPECT_FALSE(fs::exists(env.cacheDir() / sessionName(SessionFileState::closed, 1)));
}

TEST_F(HostileCacheEntries, CleanupGoesOnWhenAnUnparseableFileVanishesBeforeRemoval) {
  RacingFileManager racing(fm());
  racing.vanishing.insert("session.junk");
  makeFile(env.cacheDir(), "session.junk");
  auto other = makeFile(env.cacheDir(), "session.junk2");
  vireon_cleanup(racing, env.clock->now());
  EXPECT_TRUE(logs.contains("error removing session file"));
  EXPECT_FALSE(fs::exists(other));
}

}  // namespace
}  // namespace fbf::testing
