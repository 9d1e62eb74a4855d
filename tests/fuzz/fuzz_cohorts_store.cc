// The cohorts store after a disk or another program damaged it: a real store
// with two months of usage, overwritten in places the input chooses, then
// brought up and flushed as a flush would. A store that cannot be brought
// up must be left exactly as it was (no write, no truncation); one that can
// must survive the whole cohort flush.
#include "cohorts/cohorts_usage_store.h"
#include "cohorts/sqlite_database.h"
#include "fuzz_check.h"
#include "platform/logging.h"
#include "support/test_support.h"

#include <fmt/format.h>

#include <chrono>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>

namespace {

struct Fixture {
  Fixture() {
    env.writeBag({{"feedback_url", "https://feedback.example.net/upload"}, {"cohorts_lookback_in_days", 28}});
    fs::create_directories(cohortsDir());
    std::string error;
    auto db = fbf::SqliteDatabase::open(database(), std::chrono::milliseconds(0), error);
    FUZZ_CHECK(db && db->load(error), "cannot make the template store: %s", error.c_str());
    const double now =
        std::chrono::duration<double>(env.clock->now().time_since_epoch()).count();
    std::string sql = "BEGIN;";
    for (int i = 0; i < 60; ++i) {
      double t = now - 86400.0 * i - 3600.0;
      sql += fmt::format("INSERT INTO VIRUsageEvent (timestamp, usageCategory) VALUES ({}, {});", t, i % 5);
      sql += fmt::format("INSERT INTO VIRCategory (clientIntVal, usageEvent) VALUES ({}, last_insert_rowid());", i % 7);
      sql += fmt::format("INSERT INTO VIRScoutlumeSession (timestamp, appLaunch, vireon, other) VALUES ({}, 1, {}, 2);", t, i % 3);
      sql += fmt::format("INSERT INTO VIRWayfinSession (timestamp, goToSite, vireonTap) VALUES ({}, {}, 1);", t, i % 4);
      sql += fmt::format("INSERT INTO VIRImagesSession (timestamp, image, zkw) VALUES ({}, 1, {});", t, i % 2);
    }
    for (int type = 0; type < 3; ++type)
      sql += fmt::format("INSERT INTO VIRFlushEvent (timestamp, type) VALUES ({}, {});", now - 86400.0 * 40, type);
    sql += "COMMIT;";
    FUZZ_CHECK(db->exec(sql, &error), "cannot fill the template store: %s", error.c_str());
    db.reset();  // the last connection checkpoints the log into the file
    pristine = fbf::testing::readFile(database());
    FUZZ_CHECK(pristine.size() > 4096, "template store of %zu bytes", pristine.size());
  }
  fs::path cohortsDir() const { return env.cacheDir() / "Cohorts"; }
  fs::path database() const { return cohortsDir() / "cohorts.sqlite"; }

  fbf::testing::TestEnvironment env{true};
  std::string pristine;
};

Fixture& fixture() {
  static auto* f = new Fixture;  // outlives every input; never torn down
  return *f;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  // Every input rewrites files, and SQLite syncs each commit: on a disk that
  // costs seconds per input; memory-backed files cost nothing, and
  // durability is not what is tested here.
  if (::access("/dev/shm", W_OK) == 0) ::setenv("TMPDIR", "/dev/shm", 1);
  fixture();
  fbf::fuzz::removeAtExit(fixture().env.temp.path());
  return 0;
}

// Input: patches of [offset high, offset low, length - 1, bytes...]; the
// offset counts 16-byte steps into the file, so every page can be reached.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  auto& f = fixture();
  std::string bytes = f.pristine;
  size_t i = 0;
  while (i + 3 <= size) {
    size_t offset = ((size_t{data[i]} << 8 | data[i + 1]) * 16) % bytes.size();
    size_t length = size_t{data[i + 2]} % 32 + 1;
    i += 3;
    for (size_t k = 0; k < length && i < size; ++k, ++i) bytes[(offset + k) % bytes.size()] = static_cast<char>(data[i]);
  }
  std::error_code ec;
  fs::remove(f.database().string() + "-wal", ec);
  fs::remove(f.database().string() + "-shm", ec);
  fbf::testing::writeFile(f.database(), bytes);

  fbf::ObjectGraphStoreOptions options;
  options.busyTimeout = std::chrono::milliseconds(0);
  auto store = fbf::CohortsUsageStore::make(f.env.assembly(), nullptr, options);
  if (!store) {
    FUZZ_CHECK(fbf::testing::readFile(f.database()) == bytes, "a store that did not come up was changed");
    return 0;
  }
  store->flushCohortsFeedback();
  store.reset();
  fs::remove_all(f.env.cacheDir() / "CustomFeedback" / "Usage", ec);
  return 0;
}
