#include "util/atomic.h"
#include "util/lock.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

namespace fbf {
namespace {

// Guards against: a timed wait that keeps the lock on failure, returns without it on success, misses a wake-up, or accepts a negative timeout.
TEST(ConditionLockTimeouts, SuccessHoldsTheLockAndFailureReleasesIt) {
  ConditionLock<int> cl(1);
  EXPECT_FALSE(cl.lockWhenValue(2, 0.0));
  // Released after the zero timeout: another thread can take it (a lock
  // left held would hang here).
  std::thread([&] { cl.lockWhenValue(1); cl.unlock(); }).join();
  ASSERT_TRUE(cl.lockWhenValue(1, 5.0));
  std::atomic<bool> took{false};
  std::thread taker([&] {
    cl.lock();
    took = true;
    cl.unlock();
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  EXPECT_FALSE(took) << "held by the waiter until it unlocks";
  cl.unlock();
  taker.join();

  std::thread setter([&] {
    cl.lock();
    cl.unlockWithValue(3);
  });
  ASSERT_TRUE(cl.lockWhenValue(3, 10.0));
  EXPECT_EQ(cl.value(), 3);
  cl.unlock();
  setter.join();
  EXPECT_DEATH(cl.lockWhenValue(1, -1.0), "Fatal error");
}

// Guards against: atomics that return the old value or swap on a mismatch.
TEST(Atomics, ExchangeAddSubAndCompareAndSwapOnlyOnMatch) {
  AtomicValue<int> v(5);
  int calls = 0;
  auto nine = [&] { return ++calls, 9; };
  EXPECT_FALSE(v.compareAndSwap(4, nine));
  EXPECT_EQ(calls, 0);
  EXPECT_EQ(v.load(), 5);
  EXPECT_TRUE(v.compareAndSwap(5, nine));
  EXPECT_EQ(calls, 1);
  EXPECT_EQ(v.load(), 9);

  Atomic<int64_t> a(10);
  EXPECT_EQ(a.exchange(20), 10);
  EXPECT_EQ(a.add(5), 25);
  EXPECT_EQ(a.sub(7), 18);
  EXPECT_FALSE(a.compareAndExchange(17, 1));
  EXPECT_EQ(a.load(), 18);
  EXPECT_TRUE(a.compareAndExchange(18, 1));
  EXPECT_EQ(a.load(), 1);
}

// Guards against: a body that throws leaving the lock taken.
TEST(LockBodies, WithLockUnlocksWhenTheBodyThrows) {
  Lock lock;
  EXPECT_THROW(lock.withLock([]() -> int { throw std::runtime_error("x"); }), std::runtime_error);
  // Would deadlock (and time out the test) if the throw had left it locked.
  EXPECT_EQ(lock.withLock([] { return 3; }), 3);
}

}  // namespace
}  // namespace fbf
