// The interfaces of the usage event store: the store itself, the factory of
// new records and the fetches the cohort code needs.
//
// Every operation that touches records (the factory, the query processor,
// `lastAggregations`) must be called from a task running on the store's
// context queue (`managedObjectContext().performAndWait(...)`). The
// container's own properties (`collectionStartDate`) are fixed at bring-up
// and readable from anywhere.
//
// Fetches read what has been saved: records staged since the last save are
// not seen by them (the processor and the generator save as they go).
#pragma once

#include "cohorts/managed_object_context.h"
#include "cohorts/usage_model.h"
#include "corevireon.pb.h"

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace fbf {

// Inserts new staged records into the context it was made with. Each
// operation returns the new record, or null when the model has no entity of
// that name.
class EventFactoryProtocol {
 public:
  virtual ~EventFactoryProtocol() = default;
  virtual std::shared_ptr<VIRFlushEvent> createFlushEvent() = 0;
  // A usage event with a new category, linked both ways; without a category
  // when that cannot be made.
  virtual std::shared_ptr<VIRUsageEvent> createUsageEvent() = 0;
  virtual std::shared_ptr<VIRCategory> createCategory() = 0;
  virtual std::shared_ptr<VIRScoutlumeSession> createScoutlumeSession() = 0;
  virtual std::shared_ptr<VIRWayfinSession> createWayfinSession() = 0;
  // A record of any entity of the model, found by the record class's entity
  // name (`T::kEntityName`).
  virtual std::shared_ptr<ManagedObject> createEntity(std::string_view entityName) = 0;

  template <class T>
  std::shared_ptr<T> createEntity() {
    return std::dynamic_pointer_cast<T>(createEntity(T::kEntityName));
  }
};

class CohortQueryProcessorProtocol {
 public:
  virtual ~CohortQueryProcessorProtocol() = default;

  // The session sentinels of a client, newest first; with a range only those
  // with range.start <= timestamp < range.end. Empty (and an error line) when
  // the fetch fails.
  virtual std::vector<std::shared_ptr<VIRUsageEvent>> sessionSentinels(corevireon::CVClient client,
                                                                       std::optional<DateInterval> range) = 0;
  // The counter records of one surface entity with from <= timestamp < to,
  // in no particular order; empty, silently, when the fetch fails.
  virtual std::vector<std::shared_ptr<PropensitySession>> usageSessions(std::string_view entityName, SystemTime from,
                                                                        SystemTime to) = 0;
  // The newest flush event of a frequency.
  virtual std::shared_ptr<VIRFlushEvent> lastFlushEvent(FlushFrequency type) = 0;
  // The sum of every counter column of a surface entity over the records
  // with from <= timestamp < to, computed in the database (one aggregate
  // query); empty when the fetch fails.
  virtual std::map<std::string, int64_t> fetchColumnSums(std::string_view entityName, SystemTime from,
                                                         SystemTime to) = 0;

  template <class T>
  std::vector<std::shared_ptr<T>> usageSessions(SystemTime from, SystemTime to) {
    std::vector<std::shared_ptr<T>> typed;
    for (auto& s : usageSessions(T::kEntityName, from, to)) {
      auto t = std::dynamic_pointer_cast<T>(s);
      if (!t) return {};
      typed.push_back(std::move(t));
    }
    return typed;
  }
};

class DataStorageContainerProtocol {
 public:
  virtual ~DataStorageContainerProtocol() = default;
  virtual EventFactoryProtocol& eventFactory() = 0;
  virtual CohortQueryProcessorProtocol& queryProcessor() = 0;
  // The moment from which usage has been collected.
  virtual SystemTime collectionStartDate() const = 0;
  // The latest aggregation record per frequency. Filled asynchronously
  // shortly after bring-up; a frequency may be missing until then. Context
  // queue only.
  virtual std::map<FlushFrequency, std::shared_ptr<VIRFlushEvent>>& lastAggregations() = 0;
  virtual ManagedObjectContext& managedObjectContext() = 0;
  // Schedules the deletion of every record stamped at or before `date`
  // (categories excepted), one bulk deletion per entity.
  virtual void purgeEventsOlderThan(SystemTime date) = 0;
  // Drops every cached record and unsaved change (synchronously, on the
  // context queue). The flush that owns the store logs it.
  virtual void emptyRowCache() = 0;
};

}  // namespace fbf
