#include "cohorts/object_graph_storage_container.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "cohorts/cohort_dates.h"
#include "platform/logging.h"
#include "util/lock.h"

#include <fmt/format.h>

#include <exception>

namespace fbf {
namespace {

spdlog::logger& containerLog() { return logging::get("ObjectGraphStorageContainer"); }
spdlog::logger& queryLog() { return logging::get("ObjectGraphQueryProcessor"); }

// Purged in this order; categories are not purged here.
constexpr std::string_view kPurgedEntities[] = {"VIRUsageEvent",       "VIRFlushEvent",    "VIRWayfinSession",
                                                "VIRScoutlumeSession", "VIRImagesSession", "VIRCountedSession"};

SqlValue dateValue(SystemTime t) { return secondsSinceEpoch(t); }

template <class T>
std::vector<std::shared_ptr<T>> cast(const std::vector<std::shared_ptr<ManagedObject>>& objects) {
  std::vector<std::shared_ptr<T>> typed;
  typed.reserve(objects.size());
  for (const auto& o : objects) {
    if (auto t = std::dynamic_pointer_cast<T>(o)) typed.push_back(std::move(t));
  }
  return typed;
}

}  // namespace

// --- ObjectGraphEventFactory ------------------------------------------------

std::shared_ptr<ManagedObject> ObjectGraphEventFactory::createEntity(std::string_view entityName) {
  return context_.insertNewObject(entityName);
}

std::shared_ptr<VIRFlushEvent> ObjectGraphEventFactory::createFlushEvent() { return createEntity<VIRFlushEvent>(); }

std::shared_ptr<VIRUsageEvent> ObjectGraphEventFactory::createUsageEvent() {
  auto event = createEntity<VIRUsageEvent>();
  if (!event) return nullptr;
  if (auto category = createCategory()) {
    event->setUsageCategory(category);
    category->setUsageEvent(event);
  }
  return event;
}

std::shared_ptr<VIRCategory> ObjectGraphEventFactory::createCategory() { return createEntity<VIRCategory>(); }

std::shared_ptr<VIRScoutlumeSession> ObjectGraphEventFactory::createScoutlumeSession() {
  return createEntity<VIRScoutlumeSession>();
}

std::shared_ptr<VIRWayfinSession> ObjectGraphEventFactory::createWayfinSession() {
  return createEntity<VIRWayfinSession>();
}

// --- ObjectGraphQueryProcessor ----------------------------------------------

std::vector<std::shared_ptr<VIRUsageEvent>> ObjectGraphQueryProcessor::sessionSentinels(
    corevireon::CVClient client, std::optional<DateInterval> range) {
  auto& context = dataStorageContainer_.managedObjectContext();
  std::string tail = "JOIN VIRCategory AS c ON c.rowid = t.usageCategory WHERE ";
  std::vector<SqlValue> bindings;
  if (range) {
    tail += "? <= t.timestamp AND t.timestamp < ? AND ";
    bindings = {dateValue(range->start), dateValue(range->end)};
  }
  tail += "c.clientIntVal = ? ORDER BY t.timestamp DESC";
  bindings.emplace_back(int64_t{client});
  std::string error;
  auto rows = context.fetch(*entityNamed(VIRUsageEvent::kEntityName), tail, bindings, error);
  if (!rows) {
    queryLog().error("Error executing fetch request: {}", error);
    return {};
  }
  return cast<VIRUsageEvent>(*rows);
}

std::vector<std::shared_ptr<PropensitySession>> ObjectGraphQueryProcessor::usageSessions(std::string_view entityName,
                                                                                        SystemTime from,
                                                                                        SystemTime to) {
  const auto* entity = entityNamed(entityName);
  if (!entity) return {};
  std::string error;
  auto rows = dataStorageContainer_.managedObjectContext().fetch(*entity, "WHERE ? <= t.timestamp AND t.timestamp < ?",
                                                                {dateValue(from), dateValue(to)}, error);
  if (!rows) return {};
  auto typed = cast<PropensitySession>(*rows);
  if (typed.size() != rows->size()) return {};
  return typed;
}

std::shared_ptr<VIRFlushEvent> ObjectGraphQueryProcessor::lastFlushEvent(FlushFrequency type) {
  std::string error;
  auto rows = dataStorageContainer_.managedObjectContext().fetch(
      *entityNamed(VIRFlushEvent::kEntityName), "WHERE t.type = ? ORDER BY t.timestamp DESC, t.rowid DESC LIMIT 1",
      {SqlValue{int64_t{rawValue(type)}}}, error);
  if (!rows) {
    queryLog().error("Error executing fetch request: {}", error);
    return nullptr;
  }
  if (rows->empty()) return nullptr;
  return std::dynamic_pointer_cast<VIRFlushEvent>(rows->front());
}

std::map<std::string, int64_t> ObjectGraphQueryProcessor::fetchColumnSums(std::string_view entityName,
                                                                         SystemTime from, SystemTime to) {
  const auto* entity = entityNamed(entityName);
  if (!entity) return {};
  auto& context = dataStorageContainer_.managedObjectContext();
  context.assertOnQueue();
  std::vector<std::string> columns;
  std::string select;
  for (const auto& a : entity->attributes) {
    if (a.type != AttributeType::integer16) continue;
    columns.emplace_back(a.name);
    select += fmt::format("{}coalesce(sum({}), 0)", select.empty() ? "" : ", ", a.name);
  }
  std::string error;
  auto* stmt = context.database().cached(
      fmt::format("SELECT {} FROM {} WHERE ? <= timestamp AND timestamp < ?", select, entity->name), &error);
  if (!stmt) {
    queryLog().error("Error executing fetch request: {}", error);
    return {};
  }
  stmt->bindAll({dateValue(from), dateValue(to)});
  if (stmt->step() != SqliteStatement::Step::row) {
    queryLog().error("Error executing fetch request: {}", stmt->errorDescription());
    stmt->reset();
    return {};
  }
  std::map<std::string, int64_t> sums;
  for (size_t i = 0; i < columns.size(); ++i) sums[columns[i]] = stmt->columnInt(static_cast<int>(i));
  stmt->reset();
  return sums;
}

// --- ObjectGraphStorageContainer --------------------------------------------

ObjectGraphStorageContainer::ObjectGraphStorageContainer(FileManager& fileManager, SystemTime collectionStartDate,
                                                         fs::path databasePath)
    : fileManager_(fileManager), collectionStartDate_(collectionStartDate), databasePath_(std::move(databasePath)) {}

std::unique_ptr<ObjectGraphStorageContainer> ObjectGraphStorageContainer::make(FBFAssemblyProtocol& assembly,
                                                                               Options options) {
  return make(assembly.fileManager(), [&assembly] { return assembly.currentDate(); }, std::move(options));
}

std::unique_ptr<ObjectGraphStorageContainer> ObjectGraphStorageContainer::make(FileManager& fileManager,
                                                                               std::function<SystemTime()> now,
                                                                               Options options) {
  auto& log = containerLog();
  log.debug("Trying to bring up the ObjectGraph stack.");
  auto cacheDir = cacheDirNoCreate(fileManager);
  if (!cacheDir) return nullptr;
  fs::path cohortsDir = *cacheDir / FBFStrings::CohortsModel;
  // Deliberately before anything is created: only a directory that already
  // exists can say since when usage has been collected.
  auto attributes = fileManager.attributes(cohortsDir);
  if (!attributes) return nullptr;
  // Kept at the precision dates have in the store, so that the markers made
  // from it compare equal to it.
  SystemTime collectionStart =
      timeFromSeconds(secondsSinceEpoch(attributes->creationDateIsBirthTime ? attributes->creationDate : now()));
  fs::path databasePath = cohortsDir / FBFStrings::CohortsDB;

  std::error_code ec;
  if (!fileManager.createOrFixDirectory(cohortsDir, ec) || !fileManager.setOwnerOnlyProtection(cohortsDir, ec)) {
    return nullptr;
  }

  log.debug("Loading the Cohorts object model.");
  if (cohortsObjectModel().empty()) return nullptr;

  log.debug("Creating the persistent container.");
  std::string error;
  std::shared_ptr<SqliteDatabase> database = SqliteDatabase::open(databasePath, options.busyTimeout, error);
  if (!database) {
    log.error("Couldn't create a persistent container: {}", error);
    return nullptr;
  }
  // SQLite gives the -wal and -shm files the database file's mode.
  if (auto fileAttributes = fileManager.attributes(databasePath); fileAttributes && fileAttributes->isRegular()) {
    fileManager.setOwnerOnlyProtection(databasePath, ec);
  }
  if (!database->load(error)) {
    // The file stays as it is; the daemon runs on without cohorts.
    log.error("Couldn't load the usage store {}: {}", databasePath.string(), error);
    return nullptr;
  }

  std::unique_ptr<ObjectGraphStorageContainer> container(
      new ObjectGraphStorageContainer(fileManager, collectionStart, databasePath));
  container->queue_ = options.queue ? options.queue : std::shared_ptr<TaskQueue>(makeSerialQueue("vireon-fbf.cohortsStore"));
  container->maybePersistentContainer_ = database;
  container->maybeQueryProcessor_ = std::make_unique<ObjectGraphQueryProcessor>(*container);
  container->maybeManagedObjectContext_ = std::make_shared<ManagedObjectContext>(container->queue_, database);
  container->maybeEventFactory_ = std::make_unique<ObjectGraphEventFactory>(*container->maybeManagedObjectContext_);
  auto* self = container.get();
  container->maybeManagedObjectContext_->setDidResetHandler([self](const std::set<const ManagedObject*>& dropped) {
    // A kept aggregation record whose staged state was dropped is read anew,
    // so that the scheduler never advances a forgotten record.
    for (auto frequency : kAllFlushFrequencies) {
      auto it = self->lastAggregations_.find(frequency);
      if (it != self->lastAggregations_.end() && dropped.count(it->second.get())) self->loadLastAggregation(frequency);
    }
  });
  log.debug("ObjectGraph stack initialization finished successfully");
  container->loadLastAggregations();
  return container;
}

ObjectGraphStorageContainer::~ObjectGraphStorageContainer() {
  // Tasks already queued (a purge, the aggregation load) still run.
  if (queue_) queue_->sync([this] { lastAggregations_.clear(); });
}

std::map<FlushFrequency, std::shared_ptr<VIRFlushEvent>>& ObjectGraphStorageContainer::lastAggregations() {
  managedObjectContext().assertOnQueue();
  return lastAggregations_;
}

void ObjectGraphStorageContainer::loadLastAggregations() {
  managedObjectContext().perform([this] {
    for (auto frequency : kAllFlushFrequencies) loadLastAggregation(frequency);
  });
}

void ObjectGraphStorageContainer::loadLastAggregation(FlushFrequency frequency) {
  if (auto last = queryProcessor().lastFlushEvent(frequency)) {
    lastAggregations_[frequency] = last;
    return;
  }
  // Saved with the context's next save.
  if (auto created = VIRFlushEvent::createFlushEvent(eventFactory(), collectionStartDate_, frequency)) {
    lastAggregations_[frequency] = created;
  } else {
    lastAggregations_.erase(frequency);
  }
}

void ObjectGraphStorageContainer::purgeEventsOlderThan(SystemTime date) {
  managedObjectContext().perform([this, date] {
    auto& log = containerLog();
    log.debug("Purging events older than {}.", formatDateForLog(date));
    try {
      auto& db = *maybePersistentContainer_;
      for (auto entity : kPurgedEntities) {
        std::string error;
        // Inclusive on purpose: a record stamped exactly at `date` goes too.
        auto* stmt = db.cached(fmt::format("DELETE FROM {} WHERE ? >= timestamp", entity), &error);
        if (!stmt) {
          log.error("Error executing fetch request: {}", error);
          continue;
        }
        stmt->bindAll({dateValue(date)});
        if (stmt->step() != SqliteStatement::Step::done) log.error("Error executing fetch request: {}", stmt->errorDescription());
        stmt->reset();
      }
    } catch (const std::exception& e) {
      log.error("Exception thrown while purging old events: {}", e.what());
    }
  });
}

void ObjectGraphStorageContainer::emptyRowCache() {
  managedObjectContext().performAndWait([this] { managedObjectContext().reset(); });
}

}  // namespace fbf
