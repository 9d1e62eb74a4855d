// The cost of usage counting and of the usage store's purge.
//
//   bench-cohorts [--sessions N] [--seed S] [--size-mix small|realistic|large] [--rounds R]
//                 [--rows N,N,...]
//
// Counting: the same generated sessions (start times spread over 56 days)
// are decoded and post-processed without a store, then with a real store on
// SQLite in a temporary directory (one sentinel and one counter record per
// session that counts, each session saved as the flush saves it). Prints
// sessions per second of both and the cost per session of the counting.
//
// Purge: for each row count, a fresh store is filled with that many records
// (half usage events, half counter records of the three surfaces, half of
// them older than the cut-off), then one purge is timed. The peak resident
// memory is reset just before the purge and read after it, so the figure is
// the purge's own; it should not grow with the number of rows.
#include "cohorts/object_graph_storage_container.h"
#include "cohorts/usage_processor.h"
#include "flushing/flushable_session.h"
#include "platform/file_manager.h"
#include "platform/xdg.h"
#include "session_generator.h"

#include <sqlite3.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <string_view>
#include <vector>

namespace {

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;
using corevireon::CVClientSession;

constexpr double kNow = 1'750'000'000.0;

[[noreturn]] void die(const std::string& why) {
  std::fprintf(stderr, "bench-cohorts: %s\n", why.c_str());
  std::exit(1);
}

CVClientSession decode(const std::string& bytes) {
  CVClientSession s;
  if (!s.ParseFromString(bytes)) die("generated session does not decode");
  return s;
}

double secondsOf(const std::function<void()>& body) {
  const auto start = Clock::now();
  body();
  return std::chrono::duration<double>(Clock::now() - start).count();
}

double clockSecondsOf(clockid_t clock, const std::function<void()>& body) {
  auto now = [clock] {
    timespec t{};
    clock_gettime(clock, &t);
    return static_cast<double>(t.tv_sec) + static_cast<double>(t.tv_nsec) * 1e-9;
  };
  const double start = now();
  body();
  return now() - start;
}
double cpuSecondsOf(const std::function<void()>& body) { return clockSecondsOf(CLOCK_PROCESS_CPUTIME_ID, body); }
double threadCpuSecondsOf(const std::function<void()>& body) { return clockSecondsOf(CLOCK_THREAD_CPUTIME_ID, body); }

// kB of VmHWM (peak resident set) from /proc/self/status.
long peakResidentKb() {
  std::ifstream in("/proc/self/status");
  for (std::string line; std::getline(in, line);) {
    if (line.rfind("VmHWM:", 0) == 0) return std::strtol(line.c_str() + 6, nullptr, 10);
  }
  return -1;
}

// Lowers the peak to the current resident set (Linux 4.0 and later).
void resetPeakResident() {
  std::ofstream out("/proc/self/clear_refs");
  out << "5";
}

// A throw-away home whose cache holds the Cohorts directory.
class StoreHome {
 public:
  StoreHome() {
    std::string dirTemplate = (fs::temp_directory_path() / "bench-cohorts.XXXXXX").string();
    if (mkdtemp(dirTemplate.data()) == nullptr) die("mkdtemp failed");
    root_ = dirTemplate;
    dirs_ = fbf::XdgDirectories::underRoot(root_);
    fs::create_directories(dirs_.cacheHome / "vireond" / "Cohorts");
    fileManager_ = fbf::makePosixFileManager(dirs_);
  }
  ~StoreHome() {
    std::error_code ec;
    fs::remove_all(root_, ec);
  }

  std::unique_ptr<fbf::ObjectGraphStorageContainer> bringUp() {
    auto store = fbf::ObjectGraphStorageContainer::make(*fileManager_, [] { return fbf::timeFromSeconds(kNow); }, {});
    if (!store) die("the usage store did not come up");
    return store;
  }
  fs::path database() const { return dirs_.cacheHome / "vireond" / "Cohorts" / "cohorts.sqlite"; }

 private:
  fs::path root_;
  fbf::XdgDirectories dirs_;
  std::unique_ptr<fbf::FileManager> fileManager_;
};

void exec(sqlite3* db, const char* sql) {
  char* message = nullptr;
  if (sqlite3_exec(db, sql, nullptr, nullptr, &message) != SQLITE_OK) {
    std::string why = message ? message : "?";
    sqlite3_free(message);
    die(std::string(sql) + ": " + why);
  }
}

// Fills the store's file directly: `rows` records over the purged entities,
// stamped alternately before and after `cutoff`.
void fill(const fs::path& database, long rows, double cutoff) {
  sqlite3* db = nullptr;
  if (sqlite3_open(database.c_str(), &db) != SQLITE_OK) die("cannot open " + database.string());
  exec(db, "BEGIN");
  const char* inserts[] = {
      "INSERT INTO VIRUsageEvent (timestamp) VALUES (?)",
      "INSERT INTO VIRWayfinSession (timestamp, goToSite, vireonTap, other) VALUES (?, 1, 2, 1)",
      "INSERT INTO VIRScoutlumeSession (timestamp, appLaunch, vireon, other) VALUES (?, 2, 1, 1)",
      "INSERT INTO VIRImagesSession (timestamp, image, zkw, other) VALUES (?, 3, 1, 0)",
  };
  std::vector<sqlite3_stmt*> statements;
  for (const char* sql : inserts) {
    sqlite3_stmt* stmt = nullptr;
    if (sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr) != SQLITE_OK) die(sqlite3_errmsg(db));
    statements.push_back(stmt);
  }
  for (long i = 0; i < rows; ++i) {
    // Every other row is older than the cut-off; half of them are usage events.
    sqlite3_stmt* stmt = statements[i % 2 == 0 ? 0 : 1 + (i / 2) % 3];
    double t = (i / 2) % 2 == 0 ? cutoff - 1 - static_cast<double>(i % 86400) : cutoff + 1 + static_cast<double>(i % 86400);
    sqlite3_bind_double(stmt, 1, t);
    if (sqlite3_step(stmt) != SQLITE_DONE) die(sqlite3_errmsg(db));
    sqlite3_reset(stmt);
  }
  for (auto* stmt : statements) sqlite3_finalize(stmt);
  exec(db, "COMMIT");
  sqlite3_close(db);
}

long countRows(const fs::path& database) {
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(database.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) die("cannot reopen");
  long total = 0;
  for (const char* table : {"VIRUsageEvent", "VIRWayfinSession", "VIRScoutlumeSession", "VIRImagesSession"}) {
    sqlite3_stmt* stmt = nullptr;
    std::string sql = std::string("SELECT count(*) FROM ") + table;
    sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr);
    if (sqlite3_step(stmt) == SQLITE_ROW) total += sqlite3_column_int64(stmt, 0);
    sqlite3_finalize(stmt);
  }
  sqlite3_close(db);
  return total;
}

void benchCounting(const std::vector<std::string>& files, size_t inputBytes, int rounds) {
  std::printf("usage counting: %zu sessions, %.1f MB of session files, %d rounds\n", files.size(), inputBytes / 1e6,
              rounds);
  const double n = static_cast<double>(files.size()) * rounds;
  const double without = secondsOf([&] {
    for (int r = 0; r < rounds; ++r) {
      for (const auto& bytes : files) {
        fbf::FlushableSession session(decode(bytes));
        session.postProcessFeedback(nullptr);
      }
    }
  });
  // A store per round, so that every round counts every session afresh;
  // then the last round's sessions once more, as after a crash, which only
  // finds them counted.
  std::vector<std::unique_ptr<StoreHome>> homes;
  std::vector<std::unique_ptr<fbf::ObjectGraphStorageContainer>> stores;
  for (int r = 0; r < rounds; ++r) {
    homes.push_back(std::make_unique<StoreHome>());
    stores.push_back(homes.back()->bringUp());
  }
  // The counting is the process's CPU (the store writes on a thread of its
  // own, after the call returns) less this thread's CPU outside the calls:
  // a difference of two whole runs drowns a cost this small in the noise of
  // a shared machine. Each processor waits for its writes when it goes.
  auto countingCpu = [&](fbf::ObjectGraphStorageContainer& store) {
    double outside = 0;
    const double total = cpuSecondsOf([&] {
      fbf::UsageProcessor processor(store);
      for (const auto& bytes : files) {
        fbf::FlushableSession session;
        outside += threadCpuSecondsOf([&] { session = fbf::FlushableSession(decode(bytes)); });
        processor.reportUsageEvents(session.backingStore());
        outside += threadCpuSecondsOf([&] {
          session.postProcessFeedback(nullptr);
          session = fbf::FlushableSession();
        });
      }
    });
    return total - outside;
  };
  double counting = 0;
  for (int r = 0; r < rounds; ++r) counting += countingCpu(*stores[static_cast<size_t>(r)]);
  const double repeated = countingCpu(*stores.back());
  stores.clear();
  const StoreHome& home = *homes.back();
  std::printf("  %-40s %12.0f sessions/s\n", "decode + post-process, no store", n / without);
  std::printf("  %-40s %12.1f us/session\n", "CPU of usage counting", counting / n * 1e6);
  std::printf("  %-40s %12.1f us/session\n", "CPU of a session already counted",
              repeated / static_cast<double>(files.size()) * 1e6);
  std::printf("  %-40s %12ld rows\n", "records written", countRows(home.database()));
}

void benchPurge(long rows) {
  StoreHome home;
  const double cutoff = kNow - 10 * 86400.0;
  home.bringUp().reset();  // creates the schema
  const double fillSeconds = secondsOf([&] { fill(home.database(), rows, cutoff); });
  auto store = home.bringUp();
  // Let the asynchronous load of the last aggregations finish first.
  store->managedObjectContext().performAndWait([] {});
  resetPeakResident();
  const long before = peakResidentKb();
  const double seconds = secondsOf([&] {
    store->purgeEventsOlderThan(fbf::timeFromSeconds(cutoff));
    store->managedObjectContext().performAndWait([] {});
  });
  const long peak = peakResidentKb();
  store.reset();
  const long left = countRows(home.database());
  std::printf("  %9ld rows (filled in %.1f s): %8ld deleted in %7.3f s, peak resident %6ld kB (+%ld kB)\n", rows,
              fillSeconds, rows - left, seconds, peak, peak - before);
}

std::vector<long> parseList(const char* text) {
  std::vector<long> out;
  std::stringstream in(text);
  for (std::string item; std::getline(in, item, ',');) {
    long v = std::strtol(item.c_str(), nullptr, 10);
    if (v < 1) die("--rows takes positive numbers separated by commas");
    out.push_back(v);
  }
  return out;
}

}  // namespace

int main(int argc, char** argv) {
  int sessions = 300, rounds = 3;
  std::vector<long> purgeRows = {100'000, 1'000'000};
  fbf::sessiongen::GeneratorOptions options;
  options.seed = 42;
  options.days = 56;
  options.now = kNow;
  for (int i = 1; i + 1 < argc; i += 2) {
    std::string_view arg = argv[i];
    if (arg == "--sessions") {
      sessions = std::atoi(argv[i + 1]);
    } else if (arg == "--rounds") {
      rounds = std::atoi(argv[i + 1]);
    } else if (arg == "--seed") {
      options.seed = std::strtoull(argv[i + 1], nullptr, 10);
    } else if (arg == "--size-mix") {
      auto mix = fbf::sessiongen::sizeMixFromString(argv[i + 1]);
      if (!mix) die("--size-mix is small, realistic or large");
      options.sizeMix = *mix;
    } else if (arg == "--rows") {
      purgeRows = parseList(argv[i + 1]);
    } else {
      std::fprintf(stderr, "unknown option %s\n", argv[i]);
      return 2;
    }
  }
  if (sessions < 1 || rounds < 1) die("--sessions and --rounds must be positive");

  fbf::sessiongen::SessionGenerator generator(options);
  std::vector<std::string> files;
  size_t inputBytes = 0;
  for (int i = 0; i < sessions; ++i) {
    files.push_back(generator.nextSession().session.SerializeAsString());
    inputBytes += files.back().size();
  }
  benchCounting(files, inputBytes, rounds);

  std::printf("purge (one DELETE per entity, half the rows older than the cut-off):\n");
  for (long rows : purgeRows) benchPurge(rows);
  return 0;
}
