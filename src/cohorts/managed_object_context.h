// The working context of the usage event store: the serial queue on which
// every record is read and written, the records staged since the last save,
// and a cache of the rows materialised by fetches.
//
// Staged (inserted or changed) records stay in memory, held by the context,
// until `save` writes them all in one transaction; a failed save leaves them
// staged. `reset` drops every staged change and the row cache: a staged new
// record is forgotten, a saved record that is still referenced elsewhere
// stays usable and is staged again when it next changes.
//
// Thread-safety: everything except `queue`, `perform` and `performAndWait`
// must be called from a task running on `queue()`; calling from anywhere
// else is a programming error and stops the process. Owned (shared) by the
// storage container; records refer back to it weakly.
#pragma once

#include "cohorts/sqlite_database.h"
#include "cohorts/usage_model.h"
#include "platform/task_queue.h"

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace fbf {

class ManagedObjectContext : public std::enable_shared_from_this<ManagedObjectContext> {
 public:
  ManagedObjectContext(std::shared_ptr<TaskQueue> queue, std::shared_ptr<SqliteDatabase> database);

  TaskQueue& queue() { return *queue_; }
  void perform(Task task) { queue_->async(std::move(task)); }
  // Runs the task on the queue and returns when it is done (inline when
  // already on the queue).
  void performAndWait(const Task& task) { queue_->sync(task); }

  bool hasChanges() const;
  // Writes every staged record in one transaction. No value on success, the
  // error's description otherwise (the records then stay staged).
  std::optional<std::string> save();
  void reset();
  // Incremented by every reset.
  uint64_t generation() const { return generation_; }
  // Called on the queue after each reset with the records whose staged
  // changes it dropped (the container re-reads the records it keeps).
  using DidResetHandler = std::function<void(const std::set<const ManagedObject*>& dropped)>;
  void setDidResetHandler(DidResetHandler handler) { didReset_ = std::move(handler); }

  // A statement outside the model, run inside the transaction of the next
  // save after the staged records (so it is written with them or not at
  // all); dropped by a reset like a staged record.
  void stageStatement(std::string sql, std::vector<SqlValue> values);

  // A new staged record of the entity; null when the model has no such entity.
  std::shared_ptr<ManagedObject> insertNewObject(std::string_view entityName);

  // Runs "SELECT t.rowid, t.<columns> FROM <entity> AS t <tail>" and returns
  // the records, uniqued with those already in memory (an in-memory record
  // keeps its unsaved values). `tail` holds joins, WHERE, ORDER BY and LIMIT.
  // No value, with `error` set, when the statement fails.
  std::optional<std::vector<std::shared_ptr<ManagedObject>>> fetch(const EntityDescription& entity,
                                                                   const std::string& tail,
                                                                   const std::vector<SqlValue>& bindings,
                                                                   std::string& error);
  // One record by rowid, or null.
  std::shared_ptr<ManagedObject> existingObject(const EntityDescription& entity, int64_t rowid);

  SqliteDatabase& database() { return *database_; }
  void assertOnQueue() const;

 private:
  friend class ManagedObject;
  void didChange(const std::shared_ptr<ManagedObject>& object);
  std::shared_ptr<ManagedObject> materialize(const EntityDescription& entity, SqliteStatement& row);

  std::shared_ptr<TaskQueue> queue_;
  std::shared_ptr<SqliteDatabase> database_;
  uint64_t generation_ = 1;
  // Staged records: new ones (rowid 0) and changed saved ones.
  std::vector<std::shared_ptr<ManagedObject>> staged_;
  std::set<const ManagedObject*> stagedSet_;
  std::vector<std::pair<std::string, std::vector<SqlValue>>> stagedStatements_;
  // Materialised rows by entity and rowid; weak, so the cache does not grow
  // with what fetches return.
  std::map<std::pair<std::string_view, int64_t>, std::weak_ptr<ManagedObject>> rows_;
  DidResetHandler didReset_;
};

// Saves when the context has changes; a failure is logged, and the changes
// stay staged.
void saveOrLogError(ManagedObjectContext& context);

}  // namespace fbf
