#include "util/lock.h"

#include <gtest/gtest.h>

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
  cl.unlock();

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

// Guards against: a body that throws leaving the lock taken.
TEST(LockBodies, WithLockUnlocksWhenTheBodyThrows) {
  Lock lock;
  EXPECT_THROW(lock.withLock([]() -> int { throw std::runtime_error("x"); }), std::runtime_error);
  // Would deadlock (and time out the test) if the throw had left it locked.
  EXPECT_EQ(lock.withLock([] { return 3; }), 3);
}

}  // namespace
}  // namespace fbf
