// The usage event store on real SQLite files in a temporary cache directory.

#include "cohorts/cohort_dates.h"
#include "cohorts/object_graph_storage_container.h"
#include "cohorts_test_support.h"

#include <sys/stat.h>

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

// --- Bring-up ---------------------------------------------------------------

using StoreBringUp = StoreFixture;

TEST_F(StoreBringUp, WithoutTheCohortsDirectoryThereIsNoStoreAndNoDirectoryIsMade) {
  LogCapture logs;
  EXPECT_EQ(bringUp(), nullptr);
  EXPECT_FALSE(fs::exists(cohortsDir()));
  EXPECT_TRUE(logs.contains("Trying to bring up the ObjectGraph stack."));
}

TEST_F(StoreBringUp, CollectionStartIsTheDirectoryCreationTime) {
  makeCohortsDirectory();
  auto attributes = env.fileManager->attributes(cohortsDir());
  ASSERT_TRUE(attributes);
  env.clock->advance(hours(72));
  auto store = bringUp();
  ASSERT_NE(store, nullptr);
  SystemTime expected = attributes->creationDateIsBirthTime ? attributes->creationDate : env.clock->now();
  // Dates are kept as seconds in a double: exact to about a microsecond.
  EXPECT_LE(std::chrono::abs(store->collectionStartDate() - expected), std::chrono::microseconds(1));
}

// Reports the directory as having no birth time, as some file systems do.
class NoBirthTimeFileManager final : public FileManager {
 public:
  explicit NoBirthTimeFileManager(FileManager& real) : real_(real) {}
  std::optional<fs::path> cachesDirectory() const override { return real_.cachesDirectory(); }
  std::optional<FileAttributes> attributes(const fs::path& p, std::error_code* e) const override {
    auto a = real_.attributes(p, e);
    if (a) {
      a->creationDateIsBirthTime = false;
      a->creationDate = a->modificationDate;
    }
    return a;
  }
  std::unique_ptr<DirectoryEnumerator> enumerate(const fs::path& d) const override { return real_.enumerate(d); }
  bool moveItem(const fs::path& a, const fs::path& b, std::error_code& e) override { return real_.moveItem(a, b, e); }
  bool removeItem(const fs::path& p, std::error_code& e) override { return real_.removeItem(p, e); }
  bool copyItem(const fs::path& a, const fs::path& b, std::error_code& e) override { return real_.copyItem(a, b, e); }
  bool createOrFixDirectory(const fs::path& d, std::error_code& e) override { return real_.createOrFixDirectory(d, e); }
  FileDescriptor openForReading(const fs::path& p, std::error_code& e) const override { return real_.openForReading(p, e); }
  FileDescriptor createForWriting(const fs::path& p, std::error_code& e) override { return real_.createForWriting(p, e); }
  std::optional<std::string> readFile(const fs::path& p, std::error_code& e) const override { return real_.readFile(p, e); }
  bool writeFileAtomically(const fs::path& p, std::string_view b, std::error_code& e) override {
    return real_.writeFileAtomically(p, b, e);
  }
  bool setOwnerOnlyProtection(const fs::path& p, std::error_code& e) override { return real_.setOwnerOnlyProtection(p, e); }

 private:
  FileManager& real_;
};

TEST_F(StoreBringUp, ADirectoryWithoutBirthTimeStartsCollectionNow) {
  makeCohortsDirectory();
  env.clock->set(utcTime(2031, 3, 4, 5, 6, 7));
  NoBirthTimeFileManager fm(*env.fileManager);
  auto store = bringUp(&fm);
  ASSERT_NE(store, nullptr);
  EXPECT_EQ(store->collectionStartDate(), utcTime(2031, 3, 4, 5, 6, 7));
}

TEST_F(StoreBringUp, FirstBringUpStagesOneFlushEventPerFrequencyAtTheCollectionStart) {
  makeCohortsDirectory();
  LogCapture logs;
  auto store = bringUpAndSettle();
  ASSERT_NE(store, nullptr);
  EXPECT_TRUE(logs.contains("ObjectGraph stack initialization finished successfully"));
  onStore(*store, [&] {
    auto& aggregations = store->lastAggregations();
    ASSERT_EQ(aggregations.size(), 3u);
    for (auto f : kAllFlushFrequencies) {
      ASSERT_TRUE(aggregations.count(f));
      EXPECT_EQ(aggregations[f]->type(), rawValue(f));
      EXPECT_EQ(aggregations[f]->timestamp(), store->collectionStartDate());
      EXPECT_EQ(aggregations[f]->rowid(), 0) << "staged, not saved yet";
    }
  });
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.count("VIRFlushEvent"), 0);
  saveOrLogError(store->managedObjectContext());
  EXPECT_EQ(raw.count("VIRFlushEvent"), 3);
  EXPECT_EQ(raw.scalar("SELECT group_concat(type) FROM (SELECT type FROM VIRFlushEvent ORDER BY type)"), "0,1,2");
}

TEST_F(StoreBringUp, ASecondBringUpLoadsTheSavedAggregations) {
  makeCohortsDirectory();
  {
    auto store = bringUpAndSettle();
    onStore(*store, [&] { store->lastAggregations()[FlushFrequency::weekly]->setTimestamp(utcTime(2030, 1, 8)); });
    saveOrLogError(store->managedObjectContext());
  }
  auto store = bringUpAndSettle();
  onStore(*store, [&] {
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::weekly]->timestamp(), utcTime(2030, 1, 8));
    EXPECT_NE(store->lastAggregations()[FlushFrequency::weekly]->rowid(), 0);
  });
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.count("VIRFlushEvent"), 3);
}

TEST_F(StoreBringUp, TheFileHasTheDocumentedTablesAndIsOwnerOnly) {
  makeCohortsDirectory();
  auto store = bringUpAndSettle();
  ASSERT_NE(store, nullptr);
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.scalar("PRAGMA user_version"), "3");
  EXPECT_EQ(raw.scalar("PRAGMA journal_mode"), "wal");
  EXPECT_EQ(raw.scalar("SELECT group_concat(name) FROM (SELECT name FROM pragma_table_info('VIRUsageEvent'))"),
            "rowid,timestamp,usageCategory");
  EXPECT_EQ(raw.scalar("SELECT group_concat(name) FROM (SELECT name FROM pragma_table_info('VIRCategory'))"),
            "rowid,clientIntVal,usageEvent");
  EXPECT_EQ(raw.scalar("SELECT group_concat(name) FROM (SELECT name FROM pragma_table_info('VIRImagesSession'))"),
            "rowid,timestamp,image,querySuggestion,recentResult,zkw,other");
  struct stat st {};
  ASSERT_EQ(stat(databasePath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  ASSERT_EQ(stat(cohortsDir().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);
}

// --- Files the store must not touch ----------------------------------------

class UnusableStoreFile : public StoreFixture {
 protected:
  void SetUp() override { makeCohortsDirectory(); }
  void expectNoStoreAndFileUnchanged(const std::string& before) {
    LogCapture logs;
    EXPECT_EQ(bringUp(), nullptr);
    EXPECT_EQ(readFile(databasePath()), before);
    EXPECT_FALSE(fs::exists(databasePath().string() + "-wal"));
    EXPECT_TRUE(logs.contains("Couldn't load the usage store")) << "one clear line says why";
  }
};

TEST_F(UnusableStoreFile, ACorruptFileYieldsNoStoreAndIsLeftAlone) {
  std::string garbage(8192, '\x5a');
  writeFile(databasePath(), garbage);
  expectNoStoreAndFileUnchanged(garbage);
}

TEST_F(UnusableStoreFile, AFileOfANewerOrImpossibleSchemaVersionYieldsNoStoreAndIsLeftAlone) {
  // -1325400064: a damaged header the cohorts fuzzer wrote; it used to index
  // the migrations out of bounds.
  for (const char* version : {"9", "-1325400064"}) {
    fs::remove(databasePath());
    {
      RawDatabase raw(databasePath());
      ASSERT_TRUE(raw.exec(std::string("CREATE TABLE VIRFutureThing (x); PRAGMA user_version = ") + version + ";"));
    }
    expectNoStoreAndFileUnchanged(readFile(databasePath()));
  }
}

TEST_F(UnusableStoreFile, AFileLockedByAnotherProcessYieldsNoStoreAndIsLeftAlone) {
  {
    auto store = bringUpAndSettle();
    ASSERT_NE(store, nullptr);
    saveOrLogError(store->managedObjectContext());
  }
  {
    // Another process using the file in rollback-journal mode.
    RawDatabase raw(databasePath());
    ASSERT_TRUE(raw.exec("PRAGMA journal_mode=DELETE")) << raw.lastError();
  }
  std::string before = readFile(databasePath());
  RawDatabase holder(databasePath());
  ASSERT_TRUE(holder.exec("BEGIN EXCLUSIVE"));
  expectNoStoreAndFileUnchanged(before);
  ASSERT_TRUE(holder.exec("ROLLBACK"));
}

TEST_F(UnusableStoreFile, AForeignDatabaseWithoutAVersionIsNotTakenOver) {
  {
    RawDatabase raw(databasePath());
    ASSERT_TRUE(raw.exec("CREATE TABLE notes (body TEXT); INSERT INTO notes VALUES ('keep me');"));
  }
  expectNoStoreAndFileUnchanged(readFile(databasePath()));
}

// --- Migration --------------------------------------------------------------

using OlderStoreFile = StoreFixture;

TEST_F(OlderStoreFile, AFirstVersionFileIsMigratedWithItsRowsKept) {
  makeCohortsDirectory();
  {
    RawDatabase raw(databasePath());
    ASSERT_TRUE(raw.exec(R"sql(
CREATE TABLE VIRUsageEvent (rowid INTEGER PRIMARY KEY, timestamp REAL, usageCategory INTEGER);
CREATE TABLE VIRCategory (rowid INTEGER PRIMARY KEY, clientIntVal INTEGER, usageEvent INTEGER);
CREATE TABLE VIRFlushEvent (rowid INTEGER PRIMARY KEY, timestamp REAL, type INTEGER);
CREATE TABLE VIRScoutlumeSession (rowid INTEGER PRIMARY KEY, timestamp REAL,
  appLaunch INTEGER NOT NULL DEFAULT 0, onDeviceAddressBookData INTEGER NOT NULL DEFAULT 0,
  onDeviceOtherPersonalData INTEGER NOT NULL DEFAULT 0, punchout INTEGER NOT NULL DEFAULT 0,
  thirdPartyInAppContent INTEGER NOT NULL DEFAULT 0, vireon INTEGER NOT NULL DEFAULT 0,
  querySuggestion INTEGER NOT NULL DEFAULT 0, vexaSuggestions INTEGER NOT NULL DEFAULT 0,
  other INTEGER NOT NULL DEFAULT 0);
CREATE TABLE VIRWayfinSession (rowid INTEGER PRIMARY KEY, timestamp REAL,
  goToSite INTEGER NOT NULL DEFAULT 0, localGoto INTEGER NOT NULL DEFAULT 0,
  localTap INTEGER NOT NULL DEFAULT 0, vireonGoto INTEGER NOT NULL DEFAULT 0,
  vireonTap INTEGER NOT NULL DEFAULT 0, thirdPartyCompletionOrRecentSearch INTEGER NOT NULL DEFAULT 0,
  thirdPartyGoto INTEGER NOT NULL DEFAULT 0, thirdPartyTap INTEGER NOT NULL DEFAULT 0,
  other INTEGER NOT NULL DEFAULT 0);
INSERT INTO VIRUsageEvent VALUES (1, 1900000000, 1);
INSERT INTO VIRCategory VALUES (1, 2, 1);
INSERT INTO VIRFlushEvent VALUES (1, 1899990000, 0);
INSERT INTO VIRScoutlumeSession (timestamp, appLaunch) VALUES (1900000000, 3);
PRAGMA user_version = 1;
)sql")) << raw.lastError();
  }
  auto store = bringUpAndSettle();
  ASSERT_NE(store, nullptr);
  onStore(*store, [&] {
    auto sentinels = store->queryProcessor().sessionSentinels(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, std::nullopt);
    ASSERT_EQ(sentinels.size(), 1u);
    EXPECT_EQ(sentinels[0]->usageCategory()->clientIntVal(), 2);
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::daily]->timestamp(), timeFromSeconds(1899990000));
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::daily]->rowid(), 1);
  });
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.scalar("PRAGMA user_version"), "3");
  EXPECT_EQ(raw.count("VIRImagesSession"), 0);
  EXPECT_EQ(raw.count("VIRCountedSession"), 0);
  EXPECT_EQ(raw.scalar("SELECT appLaunch FROM VIRScoutlumeSession"), "3");
}

// --- Fetches ----------------------------------------------------------------

class StoreQueries : public StoreFixture {
 protected:
  void SetUp() override {
    makeCohortsDirectory();
    store = bringUpAndSettle();
    ASSERT_NE(store, nullptr);
  }
  void addSentinel(corevireon::CVClient client, SystemTime t) {
    onStore(*store, [&] {
      auto e = store->eventFactory().createUsageEvent();
      e->setTimestamp(t);
      e->usageCategory()->setClientIntVal(client);
    });
  }
  std::unique_ptr<ObjectGraphStorageContainer> store;
};

TEST_F(StoreQueries, RangesIncludeTheirStartAndExcludeTheirEnd) {
  SystemTime start = utcTime(2030, 5, 1);
  SystemTime end = utcTime(2030, 5, 2);
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, start - std::chrono::milliseconds(1));
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, start);
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, start + hours(12));
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, end);
  saveOrLogError(store->managedObjectContext());
  onStore(*store, [&] {
    auto inRange = store->queryProcessor().sessionSentinels(corevireon::CV_CLIENT_WEB_BROWSER, DateInterval{start, end});
    ASSERT_EQ(inRange.size(), 2u);
    EXPECT_EQ(inRange[0]->timestamp(), start + hours(12));
    EXPECT_EQ(inRange[1]->timestamp(), start);
  });
}

TEST_F(StoreQueries, SentinelsComeNewestFirstAndOnlyForTheirClient) {
  addSentinel(corevireon::CV_CLIENT_NEWS, utcTime(2030, 5, 3));
  addSentinel(corevireon::CV_CLIENT_NEWS, utcTime(2030, 5, 9));
  addSentinel(corevireon::CV_CLIENT_MESSAGING, utcTime(2030, 5, 5));
  addSentinel(corevireon::CV_CLIENT_NEWS, utcTime(2030, 5, 1));
  saveOrLogError(store->managedObjectContext());
  onStore(*store, [&] {
    auto news = store->queryProcessor().sessionSentinels(corevireon::CV_CLIENT_NEWS, std::nullopt);
    std::vector<SystemTime> times;
    for (const auto& e : news) times.push_back(*e->timestamp());
    EXPECT_EQ(times, (std::vector<SystemTime>{utcTime(2030, 5, 9), utcTime(2030, 5, 3), utcTime(2030, 5, 1)}));
    EXPECT_EQ(store->queryProcessor().sessionSentinels(corevireon::CV_CLIENT_MESSAGING, std::nullopt).size(), 1u);
    EXPECT_TRUE(store->queryProcessor().sessionSentinels(corevireon::CV_CLIENT_WEB_BROWSER, std::nullopt).empty());
  });
}

TEST_F(StoreQueries, TheLastFlushEventIsTheNewestOfItsType) {
  onStore(*store, [&] {
    VIRFlushEvent::createFlushEvent(store->eventFactory(), utcTime(2030, 2, 1), FlushFrequency::monthly);
    VIRFlushEvent::createFlushEvent(store->eventFactory(), utcTime(2030, 4, 1), FlushFrequency::monthly);
    VIRFlushEvent::createFlushEvent(store->eventFactory(), utcTime(2030, 9, 1), FlushFrequency::daily);
  });
  saveOrLogError(store->managedObjectContext());
  onStore(*store, [&] {
    auto last = store->queryProcessor().lastFlushEvent(FlushFrequency::monthly);
    ASSERT_NE(last, nullptr);
    EXPECT_EQ(last->timestamp(), utcTime(2030, 4, 1));
  });
}

TEST_F(StoreQueries, UsageSessionsAndColumnSumsCoverTheHalfOpenRange) {
  SystemTime start = utcTime(2030, 6, 1);
  SystemTime end = utcTime(2030, 7, 1);
  onStore(*store, [&] {
    for (SystemTime t : {start - seconds(1), start, end - seconds(1), end}) {
      auto s = store->eventFactory().createWayfinSession();
      s->setTimestamp(t);
      s->incrementCounter(VIRWayfinSession::goToSite);
      s->incrementCounter(VIRWayfinSession::other);
      s->incrementCounter(VIRWayfinSession::other);
    }
  });
  saveOrLogError(store->managedObjectContext());
  onStore(*store, [&] {
    EXPECT_EQ(store->queryProcessor().usageSessions<VIRWayfinSession>(start, end).size(), 2u);
    auto sums = store->queryProcessor().fetchColumnSums(VIRWayfinSession::kEntityName, start, end);
    EXPECT_EQ(sums.size(), 9u);
    EXPECT_EQ(sums["goToSite"], 2);
    EXPECT_EQ(sums["other"], 4);
    EXPECT_EQ(sums["localTap"], 0);
  });
}

// --- Purge ------------------------------------------------------------------

using StorePurge = StoreQueries;

TEST_F(StorePurge, RemovesRecordsAtOrBeforeTheDateButNoCategories) {
  SystemTime date = utcTime(2030, 3, 1);
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, date - hours(1));
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, date);
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, date + seconds(1));
  onStore(*store, [&] {
    for (SystemTime t : {date, date + seconds(1)}) {
      store->eventFactory().createScoutlumeSession()->setTimestamp(t);
      store->eventFactory().createWayfinSession()->setTimestamp(t);
      store->eventFactory().createEntity<VIRImagesSession>()->setTimestamp(t);
      VIRFlushEvent::createFlushEvent(store->eventFactory(), t, FlushFrequency::weekly);
    }
  });
  saveOrLogError(store->managedObjectContext());
  LogCapture logs;
  store->purgeEventsOlderThan(date);
  onStore(*store, [] {});
  EXPECT_TRUE(logs.contains("Purging events older than 2030-03-01 00:00:00 +0000."));
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.count("VIRUsageEvent"), 1);
  EXPECT_EQ(raw.count("VIRCategory"), 3);
  EXPECT_EQ(raw.count("VIRScoutlumeSession"), 1);
  EXPECT_EQ(raw.count("VIRWayfinSession"), 1);
  EXPECT_EQ(raw.count("VIRImagesSession"), 1);
  // The bring-up's markers (stamped at the directory's creation, before
  // 2030) go as well; only the flush event after the date stays.
  EXPECT_EQ(raw.count("VIRFlushEvent"), 1);
  EXPECT_EQ(raw.scalar("SELECT min(timestamp) > " + std::to_string(secondsSinceEpoch(date)) + " FROM VIRUsageEvent"), "1");
}

// --- Saving and the row cache ----------------------------------------------

using StoreSaving = StoreQueries;

TEST_F(StoreSaving, StagedRecordsStayInMemoryUntilSaved) {
  addSentinel(corevireon::CV_CLIENT_NEWS, utcTime(2030, 1, 1));
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.count("VIRUsageEvent"), 0);
  saveOrLogError(store->managedObjectContext());
  EXPECT_EQ(raw.count("VIRUsageEvent"), 1);
  EXPECT_EQ(raw.scalar("SELECT c.clientIntVal FROM VIRUsageEvent e JOIN VIRCategory c ON c.rowid = e.usageCategory "
                       "AND c.usageEvent = e.rowid"),
            "4");
}

TEST_F(StoreSaving, EmptyingTheRowCacheDropsUnsavedRecords) {
  saveOrLogError(store->managedObjectContext());
  addSentinel(corevireon::CV_CLIENT_NEWS, utcTime(2030, 1, 1));
  store->emptyRowCache();
  onStore(*store, [&] { EXPECT_FALSE(store->managedObjectContext().hasChanges()); });
  saveOrLogError(store->managedObjectContext());
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.count("VIRUsageEvent"), 0);
}

TEST_F(StoreSaving, AResetKeepsTheAggregationMarkersUsable) {
  // Unsaved markers are dropped by the reset and made anew; a later change
  // to them is saved.
  store->emptyRowCache();
  onStore(*store, [&] {
    ASSERT_EQ(store->lastAggregations().size(), 3u);
    store->lastAggregations()[FlushFrequency::monthly]->setTimestamp(utcTime(2030, 8, 1));
  });
  saveOrLogError(store->managedObjectContext());
  store->emptyRowCache();
  onStore(*store, [&] {
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::monthly]->timestamp(), utcTime(2030, 8, 1));
    store->lastAggregations()[FlushFrequency::monthly]->setTimestamp(utcTime(2030, 9, 1));
  });
  saveOrLogError(store->managedObjectContext());
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.count("VIRFlushEvent"), 3);
  EXPECT_EQ(raw.scalar("SELECT CAST(timestamp AS INTEGER) FROM VIRFlushEvent WHERE type = 2"),
            std::to_string(static_cast<int64_t>(secondsSinceEpoch(utcTime(2030, 9, 1)))));
}

TEST_F(StoreSaving, AFailedSaveIsLoggedAndKeepsTheChangesStaged) {
  saveOrLogError(store->managedObjectContext());
  addSentinel(corevireon::CV_CLIENT_MESSAGING, utcTime(2030, 1, 1));
  RawDatabase holder(databasePath());
  ASSERT_TRUE(holder.exec("BEGIN IMMEDIATE"));
  {
    LogCapture logs;
    saveOrLogError(store->managedObjectContext());
    EXPECT_TRUE(logs.contains("Error saving ManagedObjectContext: database is locked"));
  }
  ASSERT_TRUE(holder.exec("ROLLBACK"));
  onStore(*store, [&] { EXPECT_TRUE(store->managedObjectContext().hasChanges()); });
  saveOrLogError(store->managedObjectContext());
  EXPECT_EQ(holder.count("VIRUsageEvent"), 1);
  EXPECT_EQ(holder.count("VIRCategory"), 1);
}

TEST(StoreQueue, RecordAccessOffTheStoreQueueStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        ScopedTimeZone zone("UTC");
        TestEnvironment env;
        fs::create_directories(env.cacheDir() / "Cohorts");
        auto store = ObjectGraphStorageContainer::make(*env.fileManager, [] { return SystemTime{}; }, {});
        store->eventFactory().createFlushEvent();
      },
      "only reachable from the store's own queue");
}

}  // namespace
}  // namespace fbf::testing
