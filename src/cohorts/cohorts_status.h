// What `fbfctl status` shows of the usage cohorts: the collection start, the
// newest aggregation marker per period and the session sentinels per client
// surface.
//
// Read from the store file over a separate read-only connection, so the
// status never waits for the store's queue, never creates the file or the
// "Cohorts" directory and never migrates or changes anything. A missing,
// unreadable or foreign file (a link, a newer schema, not a database) leaves
// the reply's cohorts fields unset. Callable from any thread.
#pragma once

#include "cohorts/usage_model.h"
#include "fbf_ipc.pb.h"
#include "platform/file_manager.h"

#include <cstdint>
#include <map>
#include <optional>
#include <string_view>

namespace fbf {

struct CohortsStatus {
  // The "Cohorts" directory's birth time; absent where the file system has none.
  std::optional<SystemTime> collectionStart;
  // The newest VIRFlushEvent per frequency.
  std::map<FlushFrequency, SystemTime> lastAggregations;
  // VIRUsageEvent rows per category client code.
  std::map<int32_t, uint64_t> sentinelsPerClient;
};

// "daily", "weekly", "monthly".
std::string_view flushFrequencyName(FlushFrequency frequency);

// None when there is no readable store.
std::optional<CohortsStatus> readCohortsStatus(const FileManager& fileManager);

// Sets the reply's cohorts fields from `readCohortsStatus`; leaves them unset
// when there is no readable store.
void fillCohortsStatus(const FileManager& fileManager, ipc::StatusReply& reply);

}  // namespace fbf
