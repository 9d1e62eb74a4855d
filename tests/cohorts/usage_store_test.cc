// The usage event store on real SQLite files in a temporary cache directory.

#include "cohorts/cohort_dates.h"
#include "cohorts/object_graph_storage_container.h"
#include "cohorts_test_support.h"

namespace fbf::testing {
namespace {

// Guards against: a store invented without the Cohorts directory, a wrong collection start, markers not staged, not saved or not reloaded as the newest of their type, or a file of the wrong version or permissions.
using StoreBringUp = StoreFixture;

TEST_F(StoreBringUp, OnlyInTheCohortsDirectoryWhoseCreationTimeIsTheCollectionStart) {
  EXPECT_EQ(bringUp(), nullptr);
  EXPECT_FALSE(fs::exists(cohortsDir())) << "no directory is made";
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

TEST_F(StoreBringUp, TheFirstStagesOneMarkerPerFrequencyAndTheNextLoadsTheNewestSaved) {
  makeCohortsDirectory();
  {
    auto store = bringUpAndSettle();
    ASSERT_NE(store, nullptr);
    onStore(*store, [&] {
      auto& aggregations = store->lastAggregations();
      ASSERT_EQ(aggregations.size(), 3u);
      aggregations[FlushFrequency::weekly]->setTimestamp(utcTime(2030, 1, 8));
      for (int month : {4, 2}) {
        VIRFlushEvent::createFlushEvent(store->eventFactory(), utcTime(2030, month, 1), FlushFrequency::monthly);
      }
      VIRFlushEvent::createFlushEvent(store->eventFactory(), utcTime(2030, 9, 1), FlushFrequency::daily);
    });
    EXPECT_EQ(RawDatabase(databasePath()).count("VIRFlushEvent"), 0);
    saveOrLogError(store->managedObjectContext());
  }
  auto store = bringUpAndSettle();
  onStore(*store, [&] {
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::weekly]->timestamp(), utcTime(2030, 1, 8));
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::monthly]->timestamp(), utcTime(2030, 4, 1));
  });
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.scalar("SELECT group_concat(type) FROM (SELECT type FROM VIRFlushEvent ORDER BY type)"), "0,0,1,2,2,2");
  EXPECT_EQ(raw.scalar("PRAGMA user_version"), "3");
  EXPECT_EQ(raw.scalar("PRAGMA journal_mode"), "wal");
  EXPECT_EQ(fs::status(cohortsDir()).permissions(), fs::perms::owner_all);
}

// Guards against: the store taking over, rewriting or migrating a file it cannot use instead of giving up with one clear line.
TEST_F(StoreBringUp, AnUnusableFileYieldsNoStoreAndIsLeftAlone) {
  makeCohortsDirectory();
  const std::pair<const char*, std::string> rows[] = {
      {"corrupt", ""},  // 8 KiB of garbage
      {"newer schema", "CREATE TABLE VIRFutureThing (x); PRAGMA user_version = 9;"},
      // A damaged header the cohorts fuzzer wrote; it used to index the
      // migrations out of bounds.
      {"impossible schema", "CREATE TABLE VIRFutureThing (x); PRAGMA user_version = -1325400064;"},
      {"foreign, unversioned", "CREATE TABLE notes (body TEXT); INSERT INTO notes VALUES ('keep me');"},
      // Another process using the file in rollback-journal mode.
      {"locked by another process", "PRAGMA journal_mode=DELETE"},
  };
  for (const auto& [name, sql] : rows) {
    SCOPED_TRACE(name);
    const bool locked = sql.starts_with("PRAGMA journal_mode");
    for (const char* suffix : {"", "-wal", "-shm"}) fs::remove(databasePath().string() + suffix);
    if (locked) saveOrLogError(bringUpAndSettle()->managedObjectContext());
    if (sql.empty()) writeFile(databasePath(), std::string(8192, '\x5a'));
    ASSERT_TRUE(sql.empty() || RawDatabase(databasePath()).exec(sql));
    const std::string before = readFile(databasePath());
    RawDatabase holder(databasePath());
    ASSERT_TRUE(!locked || holder.exec("BEGIN EXCLUSIVE"));
    LogCapture logs;
    EXPECT_EQ(bringUp(), nullptr);
    EXPECT_EQ(readFile(databasePath()), before);
    EXPECT_FALSE(fs::exists(databasePath().string() + "-wal"));
    EXPECT_TRUE(logs.contains("Couldn't load the usage store")) << "one clear line says why";
    ASSERT_TRUE(!locked || holder.exec("ROLLBACK"));
  }
}

// Guards against: a first-version file losing its rows or not reaching the current schema.
TEST_F(StoreBringUp, AFirstVersionFileIsMigratedWithItsRowsKept) {
  makeCohortsDirectory();
  auto table = [](const char* name, std::initializer_list<const char*> counters) {
    std::string sql = std::string("CREATE TABLE ") + name + " (rowid INTEGER PRIMARY KEY, timestamp REAL";
    for (const char* c : counters) sql += std::string(", ") + c + " INTEGER NOT NULL DEFAULT 0";
    return sql + ");";
  };
  ASSERT_TRUE(RawDatabase(databasePath()).exec(
      table("VIRScoutlumeSession", {"appLaunch", "onDeviceAddressBookData", "onDeviceOtherPersonalData", "punchout",
                                    "thirdPartyInAppContent", "vireon", "querySuggestion", "vexaSuggestions", "other"}) +
      table("VIRWayfinSession", {"goToSite", "localGoto", "localTap", "vireonGoto", "vireonTap",
                                 "thirdPartyCompletionOrRecentSearch", "thirdPartyGoto", "thirdPartyTap", "other"}) +
      R"sql(
CREATE TABLE VIRUsageEvent (rowid INTEGER PRIMARY KEY, timestamp REAL, usageCategory INTEGER);
CREATE TABLE VIRCategory (rowid INTEGER PRIMARY KEY, clientIntVal INTEGER, usageEvent INTEGER);
CREATE TABLE VIRFlushEvent (rowid INTEGER PRIMARY KEY, timestamp REAL, type INTEGER);
INSERT INTO VIRUsageEvent VALUES (1, 1900000000, 1), (2, 4e184, 2);
INSERT INTO VIRCategory VALUES (1, 2, 1), (2, 2, 2);
INSERT INTO VIRFlushEvent VALUES (1, 1899990000, 0);
INSERT INTO VIRScoutlumeSession (timestamp, appLaunch) VALUES (1900000000, 3);
PRAGMA user_version = 1;)sql"));
  auto store = bringUpAndSettle();
  ASSERT_NE(store, nullptr);
  onStore(*store, [&] {
    auto sentinels = store->queryProcessor().sessionSentinels(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, std::nullopt);
    ASSERT_EQ(sentinels.size(), 2u);
    EXPECT_EQ(sentinels[0]->usageCategory()->clientIntVal(), 2);
    // A date no clock can hold (a damaged file) reads as none.
    EXPECT_EQ(sentinels[0]->timestamp(), std::nullopt);
    EXPECT_EQ(sentinels[1]->timestamp(), timeFromSeconds(1900000000));
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::daily]->timestamp(), timeFromSeconds(1899990000));
    EXPECT_EQ(store->lastAggregations()[FlushFrequency::daily]->rowid(), 1);
  });
  RawDatabase raw(databasePath());
  EXPECT_EQ(raw.scalar("PRAGMA user_version"), "3");
  EXPECT_EQ(raw.count("VIRImagesSession") + raw.count("VIRCountedSession"), 0);
  EXPECT_EQ(raw.scalar("SELECT appLaunch FROM VIRScoutlumeSession"), "3");
}

// Guards against: purges that include or exclude the date's edge wrongly, or remove categories.
using StoreQueries = OpenStore;

TEST_F(StoreQueries, APurgeRemovesRecordsAtOrBeforeTheDateButNoCategories) {
  SystemTime date = utcTime(2030, 3, 1);
  for (SystemTime t : {date - hours(1), date, date + seconds(1)}) addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, t);
  on([&] {
    for (SystemTime t : {date, date + seconds(1)}) {
      store->eventFactory().createScoutlumeSession()->setTimestamp(t);
      store->eventFactory().createWayfinSession()->setTimestamp(t);
      store->eventFactory().createEntity<VIRImagesSession>()->setTimestamp(t);
      VIRFlushEvent::createFlushEvent(store->eventFactory(), t, FlushFrequency::weekly);
    }
  });
  save();
  LogCapture logs;
  store->purgeEventsOlderThan(date);
  on([] {});
  EXPECT_TRUE(logs.contains("Purging events older than 2030-03-01 00:00:00 +0000."));
  // The bring-up's markers (stamped before 2030) go as well; only the flush
  // event after the date stays.
  for (const char* table : {"VIRUsageEvent", "VIRScoutlumeSession", "VIRWayfinSession", "VIRImagesSession",
                            "VIRFlushEvent"}) {
    EXPECT_EQ(rows(table), 1) << table;
  }
  EXPECT_EQ(rows("VIRCategory"), 3);
  EXPECT_EQ(sql("SELECT min(timestamp) > " + std::to_string(secondsSinceEpoch(date)) + " FROM VIRUsageEvent"), "1");
}

// Guards against: staged records written before a save, kept after the row cache is emptied, or lost when a save fails; and markers unusable after a reset.
using StoreSaving = OpenStore;

TEST_F(StoreSaving, StagedRecordsStayInMemoryUntilSavedAndAnEmptiedCacheDropsThemButKeepsTheMarkers) {
  // The bring-up's unsaved markers are dropped by a reset and made anew.
  store->emptyRowCache();
  addSentinel(corevireon::CV_CLIENT_NEWS, utcTime(2030, 1, 1));
  EXPECT_EQ(rows("VIRUsageEvent"), 0);
  save();
  EXPECT_EQ(sql("SELECT c.clientIntVal FROM VIRUsageEvent e JOIN VIRCategory c ON c.rowid = e.usageCategory "
                "AND c.usageEvent = e.rowid"),
            "4");
  addSentinel(corevireon::CV_CLIENT_NEWS, utcTime(2030, 1, 2));
  store->emptyRowCache();
  on([&] { EXPECT_FALSE(store->managedObjectContext().hasChanges()); });
  save();
  EXPECT_EQ(rows("VIRUsageEvent"), 1);
  // The markers stay usable across resets: a change to them is saved.
  setMarker(FlushFrequency::monthly, utcTime(2030, 8, 1));
  save();
  store->emptyRowCache();
  EXPECT_EQ(marker(FlushFrequency::monthly), utcTime(2030, 8, 1));
  setMarker(FlushFrequency::monthly, utcTime(2030, 9, 1));
  save();
  EXPECT_EQ(rows("VIRFlushEvent"), 3);
  EXPECT_EQ(sql("SELECT CAST(timestamp AS INTEGER) FROM VIRFlushEvent WHERE type = 2"),
            std::to_string(static_cast<int64_t>(secondsSinceEpoch(utcTime(2030, 9, 1)))));
}

TEST_F(StoreSaving, AFailedSaveIsLoggedAndKeepsTheChangesStaged) {
  save();
  addSentinel(corevireon::CV_CLIENT_MESSAGING, utcTime(2030, 1, 1));
  RawDatabase holder(databasePath());
  ASSERT_TRUE(holder.exec("BEGIN IMMEDIATE"));
  {
    LogCapture logs;
    save();
    EXPECT_TRUE(logs.contains("Error saving ManagedObjectContext: database is locked"));
  }
  ASSERT_TRUE(holder.exec("ROLLBACK"));
  on([&] { EXPECT_TRUE(store->managedObjectContext().hasChanges()); });
  save();
  EXPECT_EQ(holder.count("VIRUsageEvent") + holder.count("VIRCategory"), 2);
}

// Guards against: records reachable from a thread other than the store's own queue.
TEST_F(StoreSaving, RecordAccessOffTheStoreQueueStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(store->eventFactory().createFlushEvent(), "only reachable from the store's own queue");
}

}  // namespace
}  // namespace fbf::testing
