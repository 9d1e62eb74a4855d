// The cohorts database file on the SQLite C API: opening it, checking and
// migrating its schema, and prepared statements.
//
// This is the one place where SQLite result codes are given a meaning
// (`describeSqliteResult`). The file is never deleted, truncated or replaced
// here: a file that is not a database, is held by another process, or was
// written by a newer schema fails `load` without a write to it.
//
// Thread-safety: one connection, used by one thread at a time (bring-up on
// the constructing thread, afterwards only the store's serial queue).
#pragma once

#include "platform/file_manager.h"

#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

struct sqlite3;
struct sqlite3_stmt;

namespace fbf {

// The schema version this program writes (stored in PRAGMA user_version).
inline constexpr int kCohortsSchemaVersion = 3;

// "<message> (<result code name>)", e.g. "database is locked (SQLITE_BUSY)".
std::string describeSqliteResult(int resultCode, sqlite3* db);

using SqlValue = std::variant<std::monostate, double, int64_t>;

class SqliteStatement {
 public:
  enum class Step { row, done, error };
  SqliteStatement(sqlite3* db, sqlite3_stmt* stmt) : db_(db), stmt_(stmt) {}
  ~SqliteStatement();
  SqliteStatement(const SqliteStatement&) = delete;
  SqliteStatement& operator=(const SqliteStatement&) = delete;

  // Binds 1-based parameters in order, after clearing earlier bindings.
  void bindAll(const std::vector<SqlValue>& values);
  Step step();
  void reset();
  // Column values of the current row.
  SqlValue column(int index) const;
  int64_t columnInt(int index) const;
  std::string errorDescription() const;

 private:
  sqlite3* db_;
  sqlite3_stmt* stmt_;
  int lastResult_ = 0;
};

class SqliteDatabase {
 public:
  // Opens (creating when missing) the database file without following a
  // link. No value and `error` set when the connection cannot be made.
  static std::unique_ptr<SqliteDatabase> open(const fs::path& path, std::chrono::milliseconds busyTimeout,
                                              std::string& error);
  ~SqliteDatabase();
  SqliteDatabase(const SqliteDatabase&) = delete;
  SqliteDatabase& operator=(const SqliteDatabase&) = delete;

  // Reads the schema version; refuses a newer one; switches to WAL; creates
  // or migrates the schema to kCohortsSchemaVersion in one transaction.
  bool load(std::string& error);

  // Runs SQL without results; false with `error` set on failure.
  bool exec(std::string_view sql, std::string* error = nullptr);
  // A prepared statement kept for the connection's lifetime, reset and ready
  // to bind. Null with `error` set when the SQL does not prepare.
  SqliteStatement* cached(const std::string& sql, std::string* error);
  // Rows changed by the last statement.
  int64_t changes() const;
  int64_t lastInsertRowid() const;
  sqlite3* handle() { return db_; }

 private:
  explicit SqliteDatabase(sqlite3* db) : db_(db) {}
  std::optional<int> userVersion(std::string& error);
  bool migrate(int fromVersion, std::string& error);

  sqlite3* db_;
  std::map<std::string, std::unique_ptr<SqliteStatement>> statements_;
};

}  // namespace fbf
