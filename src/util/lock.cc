#include "util/lock.h"

#include <sys/time.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <limits>
#include <string>

namespace fbf {

void fatalError(const char* message, const char* file, int line) {
  std::fprintf(stderr, "Fatal error: %s (%s:%d)\n", message, file, line);
  std::fflush(stderr);
  std::abort();
}

namespace {
void check(int rc, const char* call) {
  if (rc != 0) {
    std::string msg = "caught error " + std::to_string(rc) + " when calling " + call;
    FBF_FATAL(msg.c_str());
  }
}
}  // namespace

Lock::Lock() : mutex_(std::make_unique<pthread_mutex_t>()) { check(pthread_mutex_init(mutex_.get(), nullptr), "pthread_mutex_init"); }
Lock::~Lock() { pthread_mutex_destroy(mutex_.get()); }
void Lock::lock() { check(pthread_mutex_lock(mutex_.get()), "pthread_mutex_lock"); }
void Lock::unlock() { check(pthread_mutex_unlock(mutex_.get()), "pthread_mutex_unlock"); }

ConditionLockBase::ConditionLockBase() : cond_(std::make_unique<pthread_cond_t>()) {
  check(pthread_cond_init(cond_.get(), nullptr), "pthread_cond_init");
}
ConditionLockBase::~ConditionLockBase() { pthread_cond_destroy(cond_.get()); }

void ConditionLockBase::wait() { check(pthread_cond_wait(cond_.get(), lock_.mutex_.get()), "pthread_cond_wait"); }

bool ConditionLockBase::waitUntil(const timespec& deadline) {
  int rc = pthread_cond_timedwait(cond_.get(), lock_.mutex_.get(), &deadline);
  if (rc == 0) return true;
  if (rc == ETIMEDOUT) return false;
  check(rc, "pthread_cond_timedwait");
  return false;
}

void ConditionLockBase::broadcast() { check(pthread_cond_broadcast(cond_.get()), "pthread_cond_broadcast"); }

// The deadline is computed the way the condition's clock (the time of day)
// expects: whole nanoseconds of the timeout plus the current microseconds.
timespec ConditionLockBase::deadlineAfter(double seconds) {
  double product = seconds * 1e9;
  if (!std::isfinite(product) || product >= 9.2e18) FBF_FATAL("timeout out of range");
  int64_t nanoseconds = static_cast<int64_t>(product);
  timeval now{};
  gettimeofday(&now, nullptr);
  int64_t total = 0;
  if (__builtin_add_overflow(nanoseconds, static_cast<int64_t>(now.tv_usec) * 1000, &total)) FBF_FATAL("arithmetic overflow");
  int64_t secs = 0;
  if (__builtin_add_overflow(static_cast<int64_t>(now.tv_sec), total / 1000000000, &secs)) FBF_FATAL("arithmetic overflow");
  timespec ts{};
  ts.tv_sec = static_cast<time_t>(secs);
  ts.tv_nsec = static_cast<long>(total % 1000000000);
  return ts;
}

}  // namespace fbf
