// OS transactions and the clean exit.
//
// A transaction keeps the process alive while work is outstanding. After a
// clean exit has been requested, the process exits as soon as no transaction
// is open (at once if none is). Thread-safe.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <string>

namespace fbf {

class Transaction {
 public:
  virtual ~Transaction() = default;
  virtual const std::string& name() const = 0;
};

class TransactionRegistry {
 public:
  // `exitHandler` runs (once, on the thread that closed the last transaction or
  // requested the exit) when the process may exit.
  explicit TransactionRegistry(std::function<void()> exitHandler);

  std::shared_ptr<Transaction> begin(std::string name);
  void requestCleanExit();
  int openCount() const;
  bool exitRequested() const;

 private:
  class Handle;
  void release();
  void maybeExitLocked(std::unique_lock<std::mutex>& lock);

  mutable std::mutex mutex_;
  int open_ = 0;
  bool exitRequested_ = false;
  bool exited_ = false;
  std::function<void()> exitHandler_;
};

}  // namespace fbf
