// Shared pieces of the cohort tests: a time zone set for one test, local and
// UTC dates, session builders, a raw SQLite handle for looking at the file
// from outside, and fixtures with a real store in a temporary cache directory.
#pragma once

#include "cohorts/object_graph_storage_container.h"
#include "support/test_support.h"

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cstdlib>
#include <ctime>
#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace fbf::testing {

// Sets TZ (and the C library's zone) for the lifetime of the object.
class ScopedTimeZone {
 public:
  explicit ScopedTimeZone(const char* zone) {
    if (const char* old = std::getenv("TZ")) previous_ = old;
    setenv("TZ", zone, 1);
    tzset();
  }
  ~ScopedTimeZone() {
    previous_ ? setenv("TZ", previous_->c_str(), 1) : unsetenv("TZ");
    tzset();
  }

 private:
  std::optional<std::string> previous_;
};

// A wall-clock time in the current TZ (or in UTC).
inline SystemTime wallTime(bool utc, int year, int month, int day, int hour, int minute, int second) {
  std::tm tm{second, minute, hour, day, month - 1, year - 1900, 0, 0, -1, 0, nullptr};
  return std::chrono::system_clock::from_time_t(utc ? timegm(&tm) : std::mktime(&tm));
}
inline SystemTime localTime(int year, int month, int day, int hour = 0, int minute = 0, int second = 0) {
  return wallTime(false, year, month, day, hour, minute, second);
}
inline SystemTime utcTime(int year, int month, int day, int hour = 0, int minute = 0, int second = 0) {
  return wallTime(true, year, month, day, hour, minute, second);
}

using std::chrono::hours;
using std::chrono::seconds;

// --- Sessions ---------------------------------------------------------------

inline corevireon::CVClientSession makeSession(const std::string& agent, SystemTime start) {
  corevireon::CVClientSession s;
  s.set_agent(agent);
  s.set_sessionstart(secondsSinceEpoch(start));
  s.mutable_feedbacks();
  return s;
}
inline corevireon::CVFeedbackPayload* addItem(corevireon::CVClientSession& s) {
  return s.mutable_feedbacks()->add_items();
}
inline void addDidGoToSite(corevireon::CVClientSession& s) { addItem(s)->mutable_didgotosite(); }
inline void addDidGoToSearch(corevireon::CVClientSession& s) { addItem(s)->mutable_didgotosearch(); }

struct ResultFields {
  std::optional<std::string> identifier = "r1";
  int32_t knownResultBundleId = 0, knownSectionBundleIdentifier = 0;
  bool isLocalApplicationResult = false, punchout = false;
};

inline corevireon::CVSearchResultForFeedback makeResult(const ResultFields& fields) {
  corevireon::CVSearchResultForFeedback r;
  if (fields.identifier) r.set_identifier(*fields.identifier);
  r.set_knownresultbundleid(fields.knownResultBundleId);
  r.set_knownsectionbundleidentifier(fields.knownSectionBundleIdentifier);
  r.set_islocalapplicationresult(fields.isLocalApplicationResult);
  if (fields.punchout) r.mutable_punchout()->set_bundleidentifier("com.example.app");
  return r;
}

inline void addResultEngagement(corevireon::CVClientSession& s, std::optional<ResultFields> result,
                                corevireon::CVTriggerEngagementEvent trigger = corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_TAP,
                                int32_t destination = 0) {
  auto* e = addItem(s)->mutable_resultengagement();
  if (result) *e->mutable_result() = makeResult(*result);
  e->set_triggerevent(trigger);
  e->set_destination(destination);
}

// --- Looking at the file from outside ---------------------------------------

class RawDatabase {
 public:
  explicit RawDatabase(const fs::path& path) { sqlite3_open(path.c_str(), &db_); }
  ~RawDatabase() { sqlite3_close_v2(db_); }
  bool exec(const std::string& sql) { return sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK; }
  // The first column of the first row, as text ("" when there is none).
  std::string scalar(const std::string& sql) {
    sqlite3_stmt* stmt = nullptr;
    std::string out;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK && sqlite3_step(stmt) == SQLITE_ROW) {
      if (auto* text = sqlite3_column_text(stmt, 0)) out = reinterpret_cast<const char*>(text);
    }
    sqlite3_finalize(stmt);
    return out;
  }
  int64_t count(const std::string& table) { return std::stoll(scalar("SELECT count(*) FROM " + table)); }

 private:
  sqlite3* db_ = nullptr;
};

// --- A store in a temporary cache directory ---------------------------------

class StoreFixture : public ::testing::Test {
 protected:
  explicit StoreFixture(const char* zone = "UTC") : zone_(zone) {}

  fs::path cohortsDir() const { return env.cacheDir() / "Cohorts"; }
  fs::path databasePath() const { return cohortsDir() / "cohorts.sqlite"; }
  void makeCohortsDirectory() { fs::create_directories(cohortsDir()); }

  std::unique_ptr<ObjectGraphStorageContainer> bringUp() {
    ObjectGraphStoreOptions options;
    options.busyTimeout = std::chrono::milliseconds(0);
    return ObjectGraphStorageContainer::make(*env.fileManager, [this] { return env.clock->now(); }, options);
  }
  // Brings the store up and waits for the last aggregations to load.
  std::unique_ptr<ObjectGraphStorageContainer> bringUpAndSettle() {
    auto store = bringUp();
    if (store) store->managedObjectContext().performAndWait([] {});
    return store;
  }
  static void onStore(DataStorageContainerProtocol& store, const std::function<void()>& work) {
    store.managedObjectContext().performAndWait(work);
  }

  ScopedTimeZone zone_;
  TestEnvironment env;
};

// A store already up, with helpers that stage records on its queue.
class OpenStore : public StoreFixture {
 protected:
  using StoreFixture::StoreFixture;
  void SetUp() override {
    makeCohortsDirectory();
    store = bringUpAndSettle();
    ASSERT_NE(store, nullptr);
  }
  void on(const std::function<void()>& work) { onStore(*store, work); }
  void save() { saveOrLogError(store->managedObjectContext()); }
  void addSentinel(corevireon::CVClient client, SystemTime t) {
    on([&] {
      auto e = store->eventFactory().createUsageEvent();
      e->setTimestamp(t);
      e->usageCategory()->setClientIntVal(client);
    });
  }
  void addWayfinSession(SystemTime t, std::initializer_list<std::pair<VIRWayfinSession::Counter, int>> counts) {
    on([&] {
      auto s = store->eventFactory().createWayfinSession();
      s->setTimestamp(t);
      for (auto [counter, n] : counts) {
        for (int i = 0; i < n; ++i) s->incrementCounter(counter);
      }
    });
  }
  void setMarker(FlushFrequency f, SystemTime t) { on([&] { store->lastAggregations()[f]->setTimestamp(t); }); }
  void setAllMarkers(SystemTime t) {
    for (auto f : kAllFlushFrequencies) setMarker(f, t);
  }
  std::optional<SystemTime> marker(FlushFrequency f) {
    std::optional<SystemTime> t;
    on([&] { t = store->lastAggregations()[f]->timestamp(); });
    return t;
  }
  // A column of the saved file, as text.
  std::string sql(const std::string& query) { return RawDatabase(databasePath()).scalar(query); }
  int64_t rows(const std::string& table) { return RawDatabase(databasePath()).count(table); }

  std::unique_ptr<ObjectGraphStorageContainer> store;
};

}  // namespace fbf::testing
