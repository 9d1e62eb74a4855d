#include "cohorts/sqlite_database.h"

#include <sqlite3.h>

#include <fmt/format.h>

namespace fbf {
namespace {

// Each entry takes the schema from version i to i + 1. Entries are frozen
// once shipped: a change to the schema is a new entry at the end.
constexpr std::string_view kMigrations[] = {
    // 0 -> 1: the first store: sentinels, categories, flush events and the
    // counters of the system search and browser surfaces.
    R"sql(
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
)sql",
    // 1 -> 2: the images surface, and indexes for the range fetches and the
    // purge, which would otherwise scan whole tables.
    R"sql(
CREATE TABLE VIRImagesSession (rowid INTEGER PRIMARY KEY, timestamp REAL,
  image INTEGER NOT NULL DEFAULT 0, querySuggestion INTEGER NOT NULL DEFAULT 0,
  recentResult INTEGER NOT NULL DEFAULT 0, zkw INTEGER NOT NULL DEFAULT 0,
  other INTEGER NOT NULL DEFAULT 0);
CREATE INDEX VIRUsageEvent_timestamp ON VIRUsageEvent (timestamp);
CREATE INDEX VIRFlushEvent_type_timestamp ON VIRFlushEvent (type, timestamp);
CREATE INDEX VIRScoutlumeSession_timestamp ON VIRScoutlumeSession (timestamp);
CREATE INDEX VIRWayfinSession_timestamp ON VIRWayfinSession (timestamp);
CREATE INDEX VIRImagesSession_timestamp ON VIRImagesSession (timestamp);
)sql",
    // 2 -> 3: the sessions whose usage has been counted, by fingerprint, so
    // that a session processed again after a crash is not counted twice.
    // "timestamp" is the session's start, for the purge.
    R"sql(
CREATE TABLE VIRCountedSession (fingerprint INTEGER PRIMARY KEY, timestamp REAL);
CREATE INDEX VIRCountedSession_timestamp ON VIRCountedSession (timestamp);
)sql",
};
static_assert(std::size(kMigrations) == kCohortsSchemaVersion);

}  // namespace

std::string describeSqliteResult(int resultCode, sqlite3* db) {
  const char* message = nullptr;
  // The connection's message is more specific, but only while it still
  // describes this result.
  if (db && sqlite3_extended_errcode(db) == resultCode) message = sqlite3_errmsg(db);
  if (!message) message = sqlite3_errstr(resultCode);
  const char* name = "SQLITE_ERROR";
  switch (resultCode & 0xff) {
    case SQLITE_BUSY: name = "SQLITE_BUSY"; break;
    case SQLITE_LOCKED: name = "SQLITE_LOCKED"; break;
    case SQLITE_NOTADB: name = "SQLITE_NOTADB"; break;
    case SQLITE_CORRUPT: name = "SQLITE_CORRUPT"; break;
    case SQLITE_CANTOPEN: name = "SQLITE_CANTOPEN"; break;
    case SQLITE_READONLY: name = "SQLITE_READONLY"; break;
    case SQLITE_FULL: name = "SQLITE_FULL"; break;
    case SQLITE_IOERR: name = "SQLITE_IOERR"; break;
    case SQLITE_PERM: name = "SQLITE_PERM"; break;
    case SQLITE_NOMEM: name = "SQLITE_NOMEM"; break;
    case SQLITE_CONSTRAINT: name = "SQLITE_CONSTRAINT"; break;
    case SQLITE_AUTH: name = "SQLITE_AUTH"; break;
    default: break;
  }
  return fmt::format("{} ({})", message, name);
}

// --- SqliteStatement --------------------------------------------------------

SqliteStatement::~SqliteStatement() { sqlite3_finalize(stmt_); }

void SqliteStatement::bindAll(const std::vector<SqlValue>& values) {
  sqlite3_reset(stmt_);
  sqlite3_clear_bindings(stmt_);
  int index = 1;
  for (const auto& v : values) {
    if (const auto* d = std::get_if<double>(&v)) {
      sqlite3_bind_double(stmt_, index, *d);
    } else if (const auto* i = std::get_if<int64_t>(&v)) {
      sqlite3_bind_int64(stmt_, index, *i);
    } else {
      sqlite3_bind_null(stmt_, index);
    }
    ++index;
  }
}

SqliteStatement::Step SqliteStatement::step() {
  lastResult_ = sqlite3_step(stmt_);
  if (lastResult_ == SQLITE_ROW) return Step::row;
  if (lastResult_ == SQLITE_DONE) return Step::done;
  return Step::error;
}

void SqliteStatement::reset() { sqlite3_reset(stmt_); }

SqlValue SqliteStatement::column(int index) const {
  switch (sqlite3_column_type(stmt_, index)) {
    case SQLITE_INTEGER: return static_cast<int64_t>(sqlite3_column_int64(stmt_, index));
    case SQLITE_FLOAT: return sqlite3_column_double(stmt_, index);
    default: return std::monostate{};
  }
}

int64_t SqliteStatement::columnInt(int index) const { return sqlite3_column_int64(stmt_, index); }

std::string SqliteStatement::errorDescription() const { return describeSqliteResult(lastResult_, db_); }

// --- SqliteDatabase ---------------------------------------------------------

std::unique_ptr<SqliteDatabase> SqliteDatabase::open(const fs::path& path, std::chrono::milliseconds busyTimeout,
                                                     std::string& error) {
  sqlite3* db = nullptr;
  int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOFOLLOW | SQLITE_OPEN_FULLMUTEX;
  int rc = sqlite3_open_v2(path.c_str(), &db, flags, nullptr);
  if (rc != SQLITE_OK) {
    error = describeSqliteResult(rc, db);
    sqlite3_close_v2(db);
    return nullptr;
  }
  sqlite3_extended_result_codes(db, 1);
  sqlite3_busy_timeout(db, static_cast<int>(busyTimeout.count()));
  return std::unique_ptr<SqliteDatabase>(new SqliteDatabase(db));
}

SqliteDatabase::~SqliteDatabase() {
  statements_.clear();
  sqlite3_close_v2(db_);
}

bool SqliteDatabase::exec(std::string_view sql, std::string* error) {
  std::string text(sql);
  int rc = sqlite3_exec(db_, text.c_str(), nullptr, nullptr, nullptr);
  if (rc != SQLITE_OK) {
    if (error) *error = describeSqliteResult(rc, db_);
    return false;
  }
  return true;
}

SqliteStatement* SqliteDatabase::cached(const std::string& sql, std::string* error) {
  auto it = statements_.find(sql);
  if (it != statements_.end()) {
    it->second->reset();
    return it->second.get();
  }
  sqlite3_stmt* stmt = nullptr;
  int rc = sqlite3_prepare_v3(db_, sql.c_str(), -1, SQLITE_PREPARE_PERSISTENT, &stmt, nullptr);
  if (rc != SQLITE_OK) {
    if (error) *error = describeSqliteResult(rc, db_);
    sqlite3_finalize(stmt);
    return nullptr;
  }
  auto [pos, _] = statements_.emplace(sql, std::make_unique<SqliteStatement>(db_, stmt));
  return pos->second.get();
}

int64_t SqliteDatabase::changes() const { return sqlite3_changes64(db_); }
int64_t SqliteDatabase::lastInsertRowid() const { return sqlite3_last_insert_rowid(db_); }

std::optional<int> SqliteDatabase::userVersion(std::string& error) {
  // Reading the header is the first access to the file: a file that is not
  // a database or is locked by another process fails here, before anything
  // is written to it.
  auto* stmt = cached("PRAGMA user_version", &error);
  if (!stmt) return std::nullopt;
  if (stmt->step() != SqliteStatement::Step::row) {
    error = stmt->errorDescription();
    stmt->reset();
    return std::nullopt;
  }
  int version = static_cast<int>(stmt->columnInt(0));
  stmt->reset();
  return version;
}

bool SqliteDatabase::load(std::string& error) {
  auto version = userVersion(error);
  if (!version) return false;
  if (*version < 0) {
    error = fmt::format("the store has an invalid schema version ({})", *version);
    return false;
  }
  if (*version > kCohortsSchemaVersion) {
    error = fmt::format("the store was written by a newer schema version ({}, this program knows {})", *version,
                        kCohortsSchemaVersion);
    return false;
  }
  if (*version == 0) {
    auto* count = cached("SELECT count(*) FROM sqlite_schema", &error);
    if (!count) return false;
    if (count->step() != SqliteStatement::Step::row) {
      error = count->errorDescription();
      return false;
    }
    bool empty = count->columnInt(0) == 0;
    count->reset();
    if (!empty) {
      error = "the file holds tables but no schema version; it is not a cohorts store";
      return false;
    }
  }
  auto* wal = cached("PRAGMA journal_mode=WAL", &error);
  if (!wal) return false;
  if (wal->step() == SqliteStatement::Step::error) {
    error = wal->errorDescription();
    return false;
  }
  wal->reset();
  // With the write-ahead log, NORMAL keeps the store consistent through a
  // crash or power loss and drops the fsync of every commit (one per
  // session): a power loss may only forget the last few commits.
  if (!exec("PRAGMA synchronous=NORMAL", &error)) return false;
  if (*version < kCohortsSchemaVersion) return migrate(*version, error);
  return true;
}

bool SqliteDatabase::migrate(int fromVersion, std::string& error) {
  if (!exec("BEGIN IMMEDIATE", &error)) return false;
  for (int v = fromVersion; v < kCohortsSchemaVersion; ++v) {
    if (!exec(kMigrations[v], &error)) {
      exec("ROLLBACK");
      error = fmt::format("migration from schema version {} failed: {}", v, error);
      return false;
    }
  }
  if (!exec(fmt::format("PRAGMA user_version = {}", kCohortsSchemaVersion), &error) || !exec("COMMIT", &error)) {
    exec("ROLLBACK");
    return false;
  }
  return true;
}

}  // namespace fbf
