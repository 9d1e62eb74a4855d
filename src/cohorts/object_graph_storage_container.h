// The usage event store on SQLite: "Cohorts/cohorts.sqlite" in the search
// daemon's cache directory.
//
// Bring-up (`make`) refuses to run until the "Cohorts" directory exists (it
// is made by the search daemon, or by `createRequiredCacheSubdirectories`):
// the directory's creation time is the collection start, so the store must
// not invent one. A file that is not a database, is locked by another
// process, or has a newer schema version yields no store; the file is left
// exactly as it was, and the daemon goes on flushing without cohorts.
//
// Lifetime: made on the work queue; all record access afterwards happens on
// the store's own serial queue ("vireon-fbf.cohortsStore"), which the
// container owns. Destroying the container runs the tasks already queued
// there, then stops the queue and closes the database.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "cohorts/usage_store.h"

#include <chrono>
#include <functional>
#include <memory>

namespace fbf {

class ObjectGraphStorageContainer;

class ObjectGraphEventFactory final : public EventFactoryProtocol {
 public:
  explicit ObjectGraphEventFactory(ManagedObjectContext& context) : context_(context) {}
  std::shared_ptr<VIRFlushEvent> createFlushEvent() override;
  std::shared_ptr<VIRUsageEvent> createUsageEvent() override;
  std::shared_ptr<VIRCategory> createCategory() override;
  std::shared_ptr<VIRScoutlumeSession> createScoutlumeSession() override;
  std::shared_ptr<VIRWayfinSession> createWayfinSession() override;
  std::shared_ptr<ManagedObject> createEntity(std::string_view entityName) override;
  using EventFactoryProtocol::createEntity;

 private:
  ManagedObjectContext& context_;  // not owned; the container owns both
};

class ObjectGraphQueryProcessor final : public CohortQueryProcessorProtocol {
 public:
  explicit ObjectGraphQueryProcessor(DataStorageContainerProtocol& dataStorageContainer)
      : dataStorageContainer_(dataStorageContainer) {}
  std::vector<std::shared_ptr<VIRUsageEvent>> sessionSentinels(corevireon::CVClient client,
                                                               std::optional<DateInterval> range) override;
  std::vector<std::shared_ptr<PropensitySession>> usageSessions(std::string_view entityName, SystemTime from,
                                                                SystemTime to) override;
  std::shared_ptr<VIRFlushEvent> lastFlushEvent(FlushFrequency type) override;
  std::map<std::string, int64_t> fetchColumnSums(std::string_view entityName, SystemTime from,
                                                 SystemTime to) override;
  using CohortQueryProcessorProtocol::usageSessions;

 private:
  DataStorageContainerProtocol& dataStorageContainer_;  // not owned; it owns this
};

struct ObjectGraphStoreOptions {
  // The store's serial queue; a new one when null.
  std::shared_ptr<TaskQueue> queue;
  // How long a statement waits for another connection's lock.
  std::chrono::milliseconds busyTimeout{250};
};

class ObjectGraphStorageContainer final : public DataStorageContainerProtocol {
 public:
  using Options = ObjectGraphStoreOptions;

  // Brings the store up, in this order: the cache directory (never created
  // here), the "Cohorts" directory's attributes (missing: no store, nothing
  // logged, nothing created), the collection start (the directory's birth
  // time, else `now()`), the directory made owner-only, the object model, the
  // database connection, the schema (checked, migrated), the context, the
  // query processor and the factory; then the last aggregations are loaded
  // asynchronously on the store's queue. Null when any step fails.
  static std::unique_ptr<ObjectGraphStorageContainer> make(FileManager& fileManager,
                                                           std::function<SystemTime()> now, Options options);
  static std::unique_ptr<ObjectGraphStorageContainer> make(FBFAssemblyProtocol& assembly, Options options = {});
  ~ObjectGraphStorageContainer() override;

  EventFactoryProtocol& eventFactory() override { return *maybeEventFactory_; }
  CohortQueryProcessorProtocol& queryProcessor() override { return *maybeQueryProcessor_; }
  SystemTime collectionStartDate() const override { return collectionStartDate_; }
  std::map<FlushFrequency, std::shared_ptr<VIRFlushEvent>>& lastAggregations() override;
  ManagedObjectContext& managedObjectContext() override { return *maybeManagedObjectContext_; }
  void purgeEventsOlderThan(SystemTime date) override;
  void emptyRowCache() override;

  const fs::path& databasePath() const { return databasePath_; }

 private:
  ObjectGraphStorageContainer(FileManager& fileManager, SystemTime collectionStartDate, fs::path databasePath);
  void loadLastAggregations();
  void loadLastAggregation(FlushFrequency frequency);

  [[maybe_unused]] FileManager& fileManager_;
  std::shared_ptr<TaskQueue> queue_;
  std::shared_ptr<SqliteDatabase> maybePersistentContainer_;
  std::shared_ptr<ManagedObjectContext> maybeManagedObjectContext_;
  std::unique_ptr<ObjectGraphQueryProcessor> maybeQueryProcessor_;
  std::unique_ptr<ObjectGraphEventFactory> maybeEventFactory_;
  SystemTime collectionStartDate_;
  fs::path databasePath_;
  std::map<FlushFrequency, std::shared_ptr<VIRFlushEvent>> lastAggregations_;
};

}  // namespace fbf
