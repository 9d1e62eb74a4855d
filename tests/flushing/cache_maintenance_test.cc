#include "flushing/session_recovery.h"

#include "assembly/fbf_strings.h"
#include "flushing/flushing_test_util.h"

#include <sys/stat.h>
#include <unistd.h>

using namespace std::chrono_literals;

namespace fbf::testing {
namespace {

// Guards against: an open session closed too early or never, or cleanup touching others.
using CleanupAfterCrashedWriters = CacheTest;

TEST_F(CleanupAfterCrashedWriters, AnOpenFileIsClosedOnlyPastHalfAnHour) {
  struct Row {
    const char* name;
    std::chrono::nanoseconds age;
    bool closes;
  };
  const Row rows[] = {{"exactly 1800 s", 1800s, false},
                      {"1801 s", 1801s, true},
                      {"age truncated to whole seconds", 1800s + 999ms, false},
                      {"created in the future", -10000s, false}};
  unsigned n = 0;
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    auto file = session(S::open, ++n);
    std::string name = file.filename().string();
    env.clock->set(creationDate(fm(), file) +
                   std::chrono::duration_cast<SystemTime::duration>(row.age));
    vireon_cleanup(fm(), env.clock->now());
    EXPECT_EQ(fs::exists(cache() / sessionName(S::closed, n)), row.closes);
    EXPECT_EQ(logs.contains("Leaving open session file " + name + "."), !row.closes);
    EXPECT_EQ(logs.contains("Moving possible orphaned open session file to closed: " + name + "."),
              row.closes);
  }
}

TEST_F(CleanupAfterCrashedWriters, OnlyUnparseableSessionNamesGoAndNoCopyIsReplaced) {
  auto closed = session(S::closed, 1);
  auto uploaded = session(S::uploaded, 2);
  auto processing = session(S::processing, 3);
  auto pending = session(S::processing, 4, ".pb.uploadPending");
  auto open = session(S::open, 5);
  auto otherCopy = makeFile(cache(), sessionName(S::closed, 5), "the other copy");
  for (const char* junk : {"session.junk", "sessionnotes", "session.12.00000001"})
    makeFile(cache(), junk);
  makeFile(cache(), "bag.plist");
  makeFile(cache() / "CustomFeedback" / "Usage", "session.junk");
  env.clock->advance(100 * 86400s);
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_EQ(entryNames(cache()),
            (std::vector<std::string>{"CustomFeedback", "bag.plist", closed.filename(),
                                      uploaded.filename(), processing.filename(),
                                      pending.filename(), otherCopy.filename(), open.filename()}));
  EXPECT_EQ(readFile(otherCopy), "the other copy");
  EXPECT_TRUE(logs.contains("error renaming session file"));
  EXPECT_TRUE(logs.contains("Ignoring file in uploaded state, but you might want to delete it: " +
                            uploaded.filename().string() + "."));
  EXPECT_TRUE(
      logs.contains("Unable to parse filename sessionnotes into a SessionFilename object."));
  EXPECT_TRUE(fs::exists(cache() / "CustomFeedback" / "Usage" / "session.junk"));
}

// Guards against: an overfull cache pruned at its limit, to the wrong size, or newest first.
class OverfullSessionDirectory : public CacheTest {
 protected:
  // Made in the order of their UUIDs, so the oldest are also the first by name
  // (creation times are coarse and often tie).
  std::vector<fs::path> fill(unsigned count) {
    std::vector<fs::path> files;
    for (unsigned i = 0; i < count; ++i)
      files.push_back(session(i % 3 ? S::processing : S::closed, i));
    return files;
  }
  void expectOldestRemoved(const std::vector<fs::path>& files, size_t removed) {
    for (size_t i = 0; i < files.size(); ++i) EXPECT_EQ(fs::exists(files[i]), i >= removed) << i;
  }
};

TEST_F(OverfullSessionDirectory, AtTheLimitAllStayOnePastItHalfTheLimitRemains) {
  const int limit = FBFConstants::MaximumNumberOfFeedbackFiles;
  auto files = fill(100);
  auto other = makeFile(cache(), "other");
  auto custom = makeFile(cache() / "CustomFeedback" / "Usage", sessionName(S::closed, 500));
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), limit), 0u);
  // Its name starts with "session", so it counts, and it is the newest.
  files.push_back(makeFile(cache(), "sessionjunk"));
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), limit), 51u);
  expectOldestRemoved(files, 51);
  EXPECT_TRUE(fs::exists(other) && fs::exists(custom));
}

TEST_F(OverfullSessionDirectory, OlderCreationDateWinsOverName) {
  auto files = fill(4);
  // The newest file by creation sorts first by name.
  makeFileCreatedAfter(fm(), files.back(), cache(), "session.0.junk");
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

// Guards against: a link, FIFO, directory or foreign file followed, opened, moved or sent.
TEST_F(CacheTest, EntriesThatAreNotOwnedRegularFilesAreNeverTouched) {
  auto secret = makeFile(env.temp.path(), "private-key", "secret");
  auto closedLink = cache() / sessionName(S::closed, 1);
  fs::create_symlink(secret, closedLink);
  fs::create_symlink(secret, cache() / sessionName(S::open, 2));
  fs::create_directories(cache() / "CustomFeedback" / "Crowdsourcing");
  fs::create_directory_symlink(env.temp.path(), cache() / "CustomFeedback" / "UserReport");
  fs::create_symlink(secret, cache() / "CustomFeedback" / "Usage");
  ASSERT_EQ(mkfifo((cache() / sessionName(S::closed, 3)).c_str(), 0600), 0);
  ASSERT_EQ(mkfifo((cache() / "CustomFeedback" / "Crowdsourcing" / "r").c_str(), 0600), 0);
  fs::create_directories(cache() / sessionName(S::open, 4));
  fs::create_directories(cache() / "session.junk");
  auto foreign = session(S::closed, 5);
  bool chowned = chown(foreign.c_str(), 65534, 65534) == 0;
  if (!chowned) fs::remove(foreign);
  auto before = entryNames(cache());
  auto besideSecret = entryNames(env.temp.path());

  env.clock->advance(100 * 86400s);
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_EQ(vireon_pruneSessionFiles(fm(), 0), 0u);
  EXPECT_TRUE(drain(FeedbackEnumerator::make(fm())).empty());  // would hang on opening a FIFO
  std::error_code error;
  EXPECT_FALSE(vireon_renameForStateChange(fm(), closedLink, S::processing, error));
  EXPECT_EQ(error, std::errc::operation_not_permitted);

  EXPECT_EQ(entryNames(cache()), before);
  EXPECT_TRUE(fs::is_symlink(closedLink));
  EXPECT_EQ(readFile(secret), "secret");
  EXPECT_EQ(entryNames(env.temp.path()), besideSecret);  // nothing moved next to the secret
  EXPECT_TRUE(logs.contains("Feedback enumerator skipped " + closedLink.string()));
}

// Guards against: sessions lost or sent twice after a kill, or a crash loop on one session.
using SessionRecovery = CacheTest;

TEST_F(SessionRecovery, EachLeftoverEndsInTheRightState) {
  auto processing = [](unsigned n) { return sessionName(S::processing, n); };
  auto upload = [&](unsigned n, std::string fmt) {
    return processing(n) + "." + fmt + ".uploadPending";
  };
  const fs::path crowd = cache() / "CustomFeedback" / "Crowdsourcing";
  for (auto name : {processing(1), upload(1, "pb"), processing(2), upload(2, "json"), processing(3),
                    sessionName(S::closed, 4), "." + upload(5, "pb") + ".partial"}) {
    makeFile(cache(), name);  // 1, 2: payload safe; 3: back to closed once; 5: half-written
  }
  for (auto name : {"report", "report.uploadPending", "other"}) makeFile(crowd, name);

  auto first = recoverInterruptedFiles(fm(), false);
  EXPECT_EQ(first.processingRemoved, 2u);
  EXPECT_EQ(first.returnedToClosed, 1u);
  EXPECT_EQ(first.customRemoved, 1u);
  EXPECT_EQ(first.partialsRemoved, 1u);
  EXPECT_EQ(entryNames(cache()),
            (std::vector<std::string>{"CustomFeedback", "fbf-interrupted", upload(1, "pb"),
                                      upload(2, "json"), sessionName(S::closed, 3),
                                      sessionName(S::closed, 4)}));
  EXPECT_EQ(entryNames(crowd), (std::vector<std::string>{"other", "report.uploadPending"}));

  // Session 3 is interrupted again: it is kept as it is, and listed.
  fs::rename(cache() / sessionName(S::closed, 3), cache() / processing(3));
  auto second = recoverInterruptedFiles(fm(), false);
  EXPECT_EQ(second.poisonFiles, 1u);
  EXPECT_EQ(poisonSessionFiles(fm()), std::vector<fs::path>{cache() / processing(3)});
  // Once the session is gone, so is its mark.
  fs::remove(cache() / processing(3));
  recoverInterruptedFiles(fm(), false);
  EXPECT_TRUE(interruptedSessionIDs(fm()).empty());

  // Feedback kept after upload: the session stays beside its upload.
  makeFile(cache(), processing(6));
  makeFile(cache(), upload(6, "pb"));
  recoverInterruptedFiles(fm(), true);
  EXPECT_TRUE(fs::exists(cache() / processing(6)));
}

}  // namespace
}  // namespace fbf::testing
