#include "flushing/cache_fixture.h"

using namespace std::chrono_literals;

namespace fbf::testing {
namespace {

// Guards against: an open session closed before its writer can have died, a
// crashed writer's file left open for ever, or cleanup touching what is not its own.
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
    EXPECT_EQ(fs::exists(file), !row.closes);
    EXPECT_EQ(fs::exists(cache() / sessionName(S::closed, n)), row.closes);
    EXPECT_EQ(logs.contains("Leaving open session file " + name + "."), !row.closes);
    EXPECT_EQ(logs.contains("Moving possible orphaned open session file to closed: " + name + "."),
              row.closes);
  }
  EXPECT_TRUE(logs.contains("Cleaning up"));
}

TEST_F(CleanupAfterCrashedWriters, ClosedUploadedAndProcessingFilesAreLeftAlone) {
  auto closed = session(S::closed, 1);
  auto uploaded = session(S::uploaded, 2);
  auto processing = session(S::processing, 3);
  auto pending = session(S::processing, 4, ".pb.uploadPending");
  env.clock->advance(100 * 86400s);
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_EQ(entryNames(cache()),
            (std::vector<std::string>{closed.filename(), uploaded.filename(), processing.filename(),
                                      pending.filename()}));
  EXPECT_TRUE(logs.contains(
      "Closed session file is ready for processing: " + closed.filename().string() + "."));
  EXPECT_TRUE(logs.contains("Ignoring file in uploaded state, but you might want to delete it: " +
                            uploaded.filename().string() + "."));
  EXPECT_EQ(logs.count(processing.filename().string()), 0u);
}

TEST_F(CleanupAfterCrashedWriters, UnparseableSessionNamesAreRemovedAndNothingElseIsTouched) {
  auto junk = makeFile(cache(), "session.junk");
  auto truncated = makeFile(cache(), "session.12." + uuidString(1));
  auto glued = makeFile(cache(), "sessionnotes");
  auto bag = makeFile(cache(), "bag.plist");
  auto custom = makeFile(cache() / "CustomFeedback" / "Usage", "session.junk");
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_FALSE(fs::exists(junk));
  EXPECT_FALSE(fs::exists(truncated));
  EXPECT_FALSE(fs::exists(glued));
  EXPECT_TRUE(fs::exists(bag));
  EXPECT_TRUE(fs::exists(custom));
  EXPECT_TRUE(
      logs.contains("Unable to parse filename session.junk into a SessionFilename object."));
  EXPECT_TRUE(
      logs.contains("Unable to parse filename sessionnotes into a SessionFilename object."));
}

TEST_F(CleanupAfterCrashedWriters, ARenameThatWouldReplaceAClosedCopyIsRefused) {
  auto open = session(S::open, 1);
  auto closed = makeFile(cache(), sessionName(S::closed, 1), "the other copy");
  env.clock->set(creationDate(fm(), open) + 3600s);
  vireon_cleanup(fm(), env.clock->now());
  EXPECT_TRUE(fs::exists(open));
  EXPECT_EQ(readFile(closed), "the other copy");
  EXPECT_TRUE(logs.contains("error renaming session file"));
}

}  // namespace
}  // namespace fbf::testing
