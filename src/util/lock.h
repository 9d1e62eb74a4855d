// Mutexes, condition locks and lock-protected cells over POSIX threads.
//
// Any failure of an underlying pthread call is a programming error and stops
// the process. All types are meant to be shared between threads.
#pragma once

#include <pthread.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

namespace fbf {

// Stops the process with "Fatal error: <message>", naming the source file.
[[noreturn]] void fatalError(const char* message, const char* file, int line);
#define FBF_FATAL(msg) ::fbf::fatalError((msg), __FILE__, __LINE__)

class Lock {
 public:
  Lock();
  ~Lock();
  Lock(const Lock&) = delete;
  Lock& operator=(const Lock&) = delete;

  void lock();
  void unlock();

  // Unlocks also when the body throws.
  template <typename F>
  auto withLock(F&& body) -> decltype(body()) {
    lock();
    struct Unlocker {
      Lock* l;
      ~Unlocker() { l->unlock(); }
    } u{this};
    return body();
  }

 private:
  friend class ConditionLockBase;
  std::unique_ptr<pthread_mutex_t> mutex_;
};

class ConditionLockBase {
 protected:
  ConditionLockBase();
  ~ConditionLockBase();
  void wait();
  // pthread_cond_timedwait until the absolute deadline; true when woken,
  // false on time-out. Any other result stops the process.
  bool waitUntil(const timespec& deadline);
  void broadcast();
  static timespec deadlineAfter(double seconds);

  Lock lock_;
  std::unique_ptr<pthread_cond_t> cond_;
};

// A mutex with a condition variable keyed on a value.
template <typename Value>
class ConditionLock : private ConditionLockBase {
 public:
  explicit ConditionLock(Value value) : value_(std::move(value)) {}

  void lock() { lock_.lock(); }
  void unlock() { lock_.unlock(); }
  const Value& value() const { return value_; }

  // Returns holding the lock once the value equals `v`.
  void lockWhenValue(const Value& v) {
    lock_.lock();
    while (!(value_ == v)) wait();
  }

  // True, holding the lock, once the value equals `v`; false, not holding the
  // lock, when `timeoutSeconds` pass first (the value is not looked at again).
  bool lockWhenValue(const Value& v, double timeoutSeconds) {
    if (timeoutSeconds < 0) FBF_FATAL("negative timeout");
    lock_.lock();
    timespec deadline = deadlineAfter(timeoutSeconds);
    while (true) {
      if (value_ == v) return true;
      if (!waitUntil(deadline)) {
        lock_.unlock();
        return false;
      }
    }
  }

  // Caller holds the lock. Sets the value, unlocks, then wakes every waiter.
  void unlockWithValue(Value v) {
    value_ = std::move(v);
    lock_.unlock();
    broadcast();
  }

 private:
  Value value_;
};

// A value cell serialised by a Lock.
template <typename Value>
class AtomicValue {
 public:
  explicit AtomicValue(Value value = Value()) : value_(std::move(value)) {}

  Value load() {
    return lock_.withLock([&] { return value_; });
  }
  void store(Value v) {
    lock_.withLock([&] { value_ = std::move(v); });
  }
  // If the value equals `expected`, stores make()'s result (called under the
  // lock) and returns true; on a mismatch `make` is never called.
  bool compareAndSwap(const Value& expected, const std::function<Value()>& make) {
    return lock_.withLock([&] {
      if (!(value_ == expected)) return false;
      value_ = make();
      return true;
    });
  }

 private:
  Lock lock_;
  Value value_;
};

}  // namespace fbf
