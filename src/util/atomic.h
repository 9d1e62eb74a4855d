// Lock-free, sequentially consistent cells for booleans and integers; suited
// to flags set from signal handlers and read from other queues.
#pragma once

#include <atomic>
#include <type_traits>

namespace fbf {

template <typename Value>
class Atomic {
  static_assert(std::is_same_v<Value, bool> || std::is_integral_v<Value>, "booleans and integers only");
  static_assert(std::atomic<Value>::is_always_lock_free, "must be lock-free");

 public:
  explicit Atomic(Value value = Value()) : storage_(value) {}
  Value load() const { return storage_.load(); }
  void store(Value v) { storage_.store(v); }
  Value exchange(Value v) { return storage_.exchange(v); }
  // Both return the new value.
  Value add(Value delta) requires(!std::is_same_v<Value, bool>) { return storage_.fetch_add(delta) + delta; }
  Value sub(Value delta) requires(!std::is_same_v<Value, bool>) { return storage_.fetch_sub(delta) - delta; }
  bool compareAndExchange(Value expected, Value desired) { return storage_.compare_exchange_strong(expected, desired); }

 private:
  std::atomic<Value> storage_;
};

}  // namespace fbf
