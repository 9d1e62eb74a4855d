#include "platform/transactions.h"

namespace fbf {

class TransactionRegistry::Handle final : public Transaction {
 public:
  Handle(TransactionRegistry* owner, std::string name) : owner_(owner), name_(std::move(name)) {}
  ~Handle() override { owner_->release(); }
  const std::string& name() const override { return name_; }

 private:
  TransactionRegistry* owner_;
  std::string name_;
};

TransactionRegistry::TransactionRegistry(std::function<void()> exitHandler)
    : exitHandler_(std::move(exitHandler)) {}

std::shared_ptr<Transaction> TransactionRegistry::begin(std::string name) {
  std::lock_guard lock(mutex_);
  ++open_;
  return std::make_shared<Handle>(this, std::move(name));
}

void TransactionRegistry::release() {
  std::unique_lock lock(mutex_);
  --open_;
  maybeExitLocked(lock);
}

void TransactionRegistry::requestCleanExit() {
  std::unique_lock lock(mutex_);
  exitRequested_ = true;
  maybeExitLocked(lock);
}

void TransactionRegistry::maybeExitLocked(std::unique_lock<std::mutex>& lock) {
  if (!exitRequested_ || open_ > 0 || exited_) return;
  exited_ = true;
  auto handler = exitHandler_;
  lock.unlock();
  if (handler) handler();
}

int TransactionRegistry::openCount() const {
  std::lock_guard lock(mutex_);
  return open_;
}

bool TransactionRegistry::exitRequested() const {
  std::lock_guard lock(mutex_);
  return exitRequested_;
}

}  // namespace fbf
