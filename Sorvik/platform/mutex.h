#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#include "Sorvik/platform/thread_annotations.h"

namespace sorvik {

// std::mutex with the annotations Clang's thread-safety analysis needs.
class CAPABILITY("mutex") Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex&) = delete;
  Mutex& operator=(const Mutex&) = delete;

  void lock() ACQUIRE() { mu_.lock(); }
  void unlock() RELEASE() { mu_.unlock(); }
  void assertHeld() ASSERT_CAPABILITY(this) {}

 private:
  friend class CondVar;
  std::mutex mu_;
};

class SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex* mu) ACQUIRE(mu) : mu_(mu) { mu_->lock(); }
  ~MutexLock() RELEASE() { mu_->unlock(); }
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

 private:
  Mutex* const mu_;
};

// Condition variable bound to one Mutex; callers hold that mutex around
// every wait and re-test their predicate after each wake-up. The waits carry
// no annotation: the analysis cannot tie the bound mutex to the caller's.
class CondVar {
 public:
  using Clock = std::chrono::steady_clock;

  explicit CondVar(Mutex* mu) : mu_(mu) {}
  CondVar(const CondVar&) = delete;
  CondVar& operator=(const CondVar&) = delete;

  void wait() {
    std::unique_lock<std::mutex> lock(mu_->mu_, std::adopt_lock);
    cv_.wait(lock);
    lock.release();
  }
  // False once the deadline has passed.
  bool waitUntil(Clock::time_point deadline) {
    std::unique_lock<std::mutex> lock(mu_->mu_, std::adopt_lock);
    const bool notTimedOut = cv_.wait_until(lock, deadline) == std::cv_status::no_timeout;
    lock.release();
    return notTimedOut;
  }
  void signalAll() { cv_.notify_all(); }

 private:
  Mutex* const mu_;
  std::condition_variable cv_;
};

// Now plus `amount`, clamped to the clock's largest time instead of overflowing.
template <typename Rep, typename Period>
CondVar::Clock::time_point saturatingDeadline(std::chrono::duration<Rep, Period> amount) {
  const auto now = CondVar::Clock::now();
  const auto room = CondVar::Clock::time_point::max() - now;
  if (amount <= std::chrono::duration<Rep, Period>::zero()) return now;
  if (std::chrono::duration_cast<std::chrono::duration<double>>(amount) >=
      std::chrono::duration_cast<std::chrono::duration<double>>(room)) {
    return CondVar::Clock::time_point::max();
  }
  return now + std::chrono::duration_cast<CondVar::Clock::duration>(amount);
}

}  // namespace sorvik
