#include "cohorts/managed_object_context.h"

#include "platform/logging.h"
#include "util/lock.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <exception>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace fbf {
namespace {

std::string selectList(const EntityDescription& entity) {
  std::string columns = "t.rowid";
  for (const auto& a : entity.attributes) columns += fmt::format(", t.{}", a.name);
  for (const auto& r : entity.relationships) columns += fmt::format(", t.{}", r.name);
  return columns;
}

std::string insertSql(const EntityDescription& entity, bool withRowid) {
  // Joined from a list rather than appended piecewise: GCC 12 at -O3 reports
  // a bogus overlapping copy (-Wrestrict) for the appending form.
  std::vector<std::string_view> columns;
  if (withRowid) columns.emplace_back("rowid");
  for (const auto& a : entity.attributes) columns.push_back(a.name);
  std::vector<std::string_view> marks(columns.size(), "?");
  return fmt::format("{} INTO {} ({}) VALUES ({})", withRowid ? "INSERT OR REPLACE" : "INSERT", entity.name,
                     fmt::join(columns, ", "), fmt::join(marks, ", "));
}

}  // namespace

ManagedObjectContext::ManagedObjectContext(std::shared_ptr<TaskQueue> queue, std::shared_ptr<SqliteDatabase> database)
    : queue_(std::move(queue)), database_(std::move(database)) {}

void ManagedObjectContext::assertOnQueue() const {
  if (!queue_->isCurrent()) FBF_FATAL("usage store records are only reachable from the store's own queue");
}

bool ManagedObjectContext::hasChanges() const {
  assertOnQueue();
  return !staged_.empty() || !stagedStatements_.empty();
}

void ManagedObjectContext::stageStatement(std::string sql, std::vector<SqlValue> values) {
  assertOnQueue();
  stagedStatements_.emplace_back(std::move(sql), std::move(values));
}

std::shared_ptr<ManagedObject> ManagedObjectContext::insertNewObject(std::string_view entityName) {
  assertOnQueue();
  const auto* entity = entityNamed(entityName);
  if (!entity) return nullptr;
  auto object = makeRecord(*entity);
  object->context_ = weak_from_this();
  object->generation_ = generation_;
  stagedSet_.insert(object.get());
  staged_.push_back(std::move(object));
  return staged_.back();
}

void ManagedObjectContext::didChange(const std::shared_ptr<ManagedObject>& object) {
  assertOnQueue();
  if (object->generation_ != generation_) {
    // A new record whose staging a reset dropped stays forgotten.
    if (object->rowid_ == 0) return;
    object->generation_ = generation_;
    rows_[{object->entity().name, object->rowid_}] = object;
  }
  if (stagedSet_.insert(object.get()).second) staged_.push_back(object);
}

std::optional<std::string> ManagedObjectContext::save() {
  assertOnQueue();
  if (staged_.empty() && stagedStatements_.empty()) return std::nullopt;
  auto& db = *database_;
  std::string error;
  if (!db.exec("BEGIN IMMEDIATE", &error)) return error;

  auto fail = [&](std::string message) {
    db.exec("ROLLBACK");
    return std::optional<std::string>(std::move(message));
  };

  // Rowids are applied only after the commit, so that a failed save leaves
  // every record exactly as staged.
  std::unordered_map<const ManagedObject*, int64_t> assigned;
  for (const auto& object : staged_) {
    const auto& entity = object->entity();
    bool existing = object->rowid_ != 0;
    auto* stmt = db.cached(insertSql(entity, existing), &error);
    if (!stmt) return fail(error);
    std::vector<SqlValue> values;
    if (existing) values.emplace_back(object->rowid_);
    for (const auto& v : object->values_) values.push_back(v);
    stmt->bindAll(values);
    if (stmt->step() != SqliteStatement::Step::done) return fail(stmt->errorDescription());
    if (!existing) assigned[object.get()] = db.lastInsertRowid();
  }
  // Relationships point at rowids, which new records only have now.
  for (const auto& object : staged_) {
    const auto& entity = object->entity();
    int64_t rowid = object->rowid_ != 0 ? object->rowid_ : assigned[object.get()];
    for (size_t r = 0; r < entity.relationships.size(); ++r) {
      const auto& slot = object->relationships_[r];
      std::shared_ptr<ManagedObject> destination = slot.strong ? slot.strong : slot.weak.lock();
      int64_t target = slot.unresolvedRowid;
      if (destination) {
        target = destination->rowid_;
        if (target == 0) {
          auto it = assigned.find(destination.get());
          target = it == assigned.end() ? 0 : it->second;
        }
      }
      auto* stmt = db.cached(fmt::format("UPDATE {} SET {} = ? WHERE rowid = ?", entity.name, entity.relationships[r].name),
                             &error);
      if (!stmt) return fail(error);
      stmt->bindAll({target == 0 ? SqlValue{} : SqlValue{target}, SqlValue{rowid}});
      if (stmt->step() != SqliteStatement::Step::done) return fail(stmt->errorDescription());
    }
  }
  for (const auto& [sql, values] : stagedStatements_) {
    auto* stmt = db.cached(sql, &error);
    if (!stmt) return fail(error);
    stmt->bindAll(values);
    bool failed = stmt->step() == SqliteStatement::Step::error;
    std::string why = failed ? stmt->errorDescription() : std::string();
    stmt->reset();
    if (failed) return fail(why);
  }
  if (!db.exec("COMMIT", &error)) return fail(error);

  for (const auto& object : staged_) {
    if (object->rowid_ == 0) object->rowid_ = assigned[object.get()];
    rows_[{object->entity().name, object->rowid_}] = object;
  }
  staged_.clear();
  stagedSet_.clear();
  stagedStatements_.clear();
  return std::nullopt;
}

void ManagedObjectContext::reset() {
  assertOnQueue();
  std::set<const ManagedObject*> dropped = std::move(stagedSet_);
  // A changed saved record no longer matches its row: fetches read it anew.
  for (const auto& object : staged_) {
    if (object->rowid_ != 0) rows_.erase({object->entity().name, object->rowid_});
  }
  staged_.clear();
  stagedSet_.clear();
  stagedStatements_.clear();
  for (auto it = rows_.begin(); it != rows_.end();) {
    it = it->second.expired() ? rows_.erase(it) : std::next(it);
  }
  ++generation_;
  // Records that stay in memory elsewhere belong to the new generation.
  for (auto& [key, weak] : rows_) {
    if (auto object = weak.lock()) object->generation_ = generation_;
  }
  if (didReset_) didReset_(dropped);
}

std::shared_ptr<ManagedObject> ManagedObjectContext::materialize(const EntityDescription& entity,
                                                                 SqliteStatement& row) {
  int64_t rowid = row.columnInt(0);
  auto key = std::make_pair(entity.name, rowid);
  if (auto it = rows_.find(key); it != rows_.end()) {
    if (auto alive = it->second.lock()) return alive;
  }
  auto object = makeRecord(entity);
  object->rowid_ = rowid;
  int column = 1;
  for (size_t a = 0; a < entity.attributes.size(); ++a, ++column) object->values_[a] = row.column(column);
  for (size_t r = 0; r < entity.relationships.size(); ++r, ++column) {
    auto v = row.column(column);
    if (const auto* i = std::get_if<int64_t>(&v)) object->relationships_[r].unresolvedRowid = *i;
  }
  object->context_ = weak_from_this();
  object->generation_ = generation_;
  rows_[key] = object;
  return object;
}

std::optional<std::vector<std::shared_ptr<ManagedObject>>> ManagedObjectContext::fetch(
    const EntityDescription& entity, const std::string& tail, const std::vector<SqlValue>& bindings,
    std::string& error) {
  assertOnQueue();
  auto* stmt =
      database_->cached(fmt::format("SELECT {} FROM {} AS t {}", selectList(entity), entity.name, tail), &error);
  if (!stmt) return std::nullopt;
  stmt->bindAll(bindings);
  std::vector<std::shared_ptr<ManagedObject>> result;
  for (;;) {
    auto step = stmt->step();
    if (step == SqliteStatement::Step::done) break;
    if (step == SqliteStatement::Step::error) {
      error = stmt->errorDescription();
      stmt->reset();
      return std::nullopt;
    }
    result.push_back(materialize(entity, *stmt));
  }
  stmt->reset();
  return result;
}

std::shared_ptr<ManagedObject> ManagedObjectContext::existingObject(const EntityDescription& entity, int64_t rowid) {
  std::string error;
  auto rows = fetch(entity, "WHERE t.rowid = ?", {SqlValue{rowid}}, error);
  if (!rows || rows->empty()) return nullptr;
  return rows->front();
}

void saveOrLogError(ManagedObjectContext& context) {
  auto& log = logging::get("ObjectGraphStorageContainer");
  context.performAndWait([&] {
    if (!context.hasChanges()) return;
    try {
      if (auto error = context.save()) log.error("Error saving ManagedObjectContext: {}", *error);
    } catch (const std::exception& e) {
      log.error("Exception thrown while saving ManagedObjectContext: {}", e.what());
    }
  });
}

}  // namespace fbf
