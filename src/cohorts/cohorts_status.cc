#include "cohorts/cohorts_status.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "cohorts/sqlite_database.h"
#include "platform/logging.h"

#include <sqlite3.h>
#include <unistd.h>

#include <memory>

namespace fbf {
namespace {

struct Closer {
  void operator()(sqlite3* db) const { sqlite3_close_v2(db); }
};
struct Finalizer {
  void operator()(sqlite3_stmt* stmt) const { sqlite3_finalize(stmt); }
};
using Connection = std::unique_ptr<sqlite3, Closer>;
using Statement = std::unique_ptr<sqlite3_stmt, Finalizer>;

// A status request must not hang behind a writer holding its lock for long.
constexpr int kBusyTimeoutMs = 200;

Statement prepare(sqlite3* db, const char* sql) {
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr) != SQLITE_OK) return nullptr;
  return Statement(stmt);
}

}  // namespace

std::string_view flushFrequencyName(FlushFrequency frequency) {
  switch (frequency) {
    case FlushFrequency::daily:
      return "daily";
    case FlushFrequency::weekly:
      return "weekly";
    case FlushFrequency::monthly:
      return "monthly";
  }
  return "unknown";
}

std::optional<CohortsStatus> readCohortsStatus(const FileManager& fileManager) {
  auto cacheDir = cacheDirNoCreate(fileManager);
  if (!cacheDir) return std::nullopt;
  const fs::path cohortsDir = *cacheDir / FBFStrings::CohortsModel;
  auto dirAttributes = fileManager.attributes(cohortsDir);
  if (!dirAttributes || !dirAttributes->isDirectory()) return std::nullopt;
  const fs::path databasePath = cohortsDir / FBFStrings::CohortsDB;
  // Only our own regular file; a link is never followed.
  auto fileAttributes = fileManager.attributes(databasePath);
  if (!fileAttributes || !fileAttributes->isRegular() || fileAttributes->owner != geteuid()) return std::nullopt;

  sqlite3* raw = nullptr;
  int rc = sqlite3_open_v2(databasePath.c_str(), &raw, SQLITE_OPEN_READONLY | SQLITE_OPEN_NOFOLLOW, nullptr);
  Connection db(raw);
  auto& log = logging::get("CohortsStatus");
  if (rc != SQLITE_OK) {
    log.debug("Cannot read the usage store for the status: {}", describeSqliteResult(rc, raw));
    return std::nullopt;
  }
  sqlite3_busy_timeout(db.get(), kBusyTimeoutMs);

  // A file of another (newer or unknown) schema is not interpreted.
  auto version = prepare(db.get(), "PRAGMA user_version");
  if (!version || sqlite3_step(version.get()) != SQLITE_ROW) {
    log.debug("Cannot read the usage store for the status: {}", sqlite3_errmsg(db.get()));
    return std::nullopt;
  }
  if (sqlite3_column_int(version.get(), 0) != kCohortsSchemaVersion) return std::nullopt;

  CohortsStatus status;
  // At the precision the store keeps it, as bring-up does.
  if (dirAttributes->creationDateIsBirthTime) {
    status.collectionStart = timeFromSeconds(secondsSinceEpoch(dirAttributes->creationDate));
  }

  auto aggregations = prepare(db.get(), "SELECT type, max(timestamp) FROM VIRFlushEvent GROUP BY type");
  if (!aggregations) return std::nullopt;
  while (sqlite3_step(aggregations.get()) == SQLITE_ROW) {
    auto frequency = flushFrequencyFromRawValue(sqlite3_column_int64(aggregations.get(), 0));
    if (!frequency || sqlite3_column_type(aggregations.get(), 1) == SQLITE_NULL) continue;
    status.lastAggregations[*frequency] = timeFromSeconds(sqlite3_column_double(aggregations.get(), 1));
  }

  auto sentinels = prepare(db.get(),
                           "SELECT c.clientIntVal, count(*) FROM VIRUsageEvent AS u "
                           "JOIN VIRCategory AS c ON c.rowid = u.usageCategory GROUP BY c.clientIntVal");
  if (!sentinels) return std::nullopt;
  while (sqlite3_step(sentinels.get()) == SQLITE_ROW) {
    status.sentinelsPerClient[sqlite3_column_int(sentinels.get(), 0)] =
        static_cast<uint64_t>(sqlite3_column_int64(sentinels.get(), 1));
  }
  return status;
}

void fillCohortsStatus(const FileManager& fileManager, ipc::StatusReply& reply) {
  auto status = readCohortsStatus(fileManager);
  if (!status) return;
  if (status->collectionStart) reply.set_cohortscollectionstart(secondsSinceEpoch(*status->collectionStart));
  for (const auto& [frequency, timestamp] : status->lastAggregations) {
    auto* item = reply.add_cohortslastaggregations();
    item->set_frequency(std::string(flushFrequencyName(frequency)));
    item->set_timestamp(secondsSinceEpoch(timestamp));
  }
  for (const auto& [client, count] : status->sentinelsPerClient) {
    auto* item = reply.add_cohortssentinels();
    item->set_client(client);
    item->set_count(count);
  }
}

}  // namespace fbf
