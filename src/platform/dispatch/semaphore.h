#pragma once

// Counting semaphore for handing a result from one thread to a waiting one.
//
// signal() adds one and wakes a waiter; wait() takes one, blocking until there is one;
// waitFor()/waitUntil() give up at a deadline and then return false, taking nothing. A signal
// that arrives after a timed-out wait simply stays in the count. The count saturates instead of
// overflowing, so signals without waits never fail or block. Safe to destroy as soon as the last
// wait has returned, even while the signalling thread is still leaving signal(). A worker of a
// pool that waits here tells its pool, which may start another worker meanwhile or, when none can
// be started, have the waiter run the pool's waiting work (see WorkerPool).

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <optional>

#include "platform/dispatch/worker_pool.h"

namespace platform {

class Semaphore final : private WorkerPool::HelpWaker {
 public:
  // Aborts if `value` is negative (a programming error).
  explicit Semaphore(long value = 0);
  Semaphore(const Semaphore&) = delete;
  Semaphore& operator=(const Semaphore&) = delete;
  ~Semaphore();

  // signal adds one to the count and wakes a waiter; it never fails.
  void signal();
  // wait takes one from the count, blocking until there is one.
  void wait();
  // waitFor and waitUntil return true if a signal was taken before the deadline, false (taking
  // nothing) otherwise; a zero or negative timeout only polls.
  bool waitFor(std::chrono::nanoseconds timeout);
  bool waitUntil(std::chrono::steady_clock::time_point deadline);

 private:
  bool take(std::optional<std::chrono::steady_clock::time_point> deadline);
  void wakeToHelp() override;

  std::mutex mutex_;
  std::condition_variable available_;
  long count_;
  std::atomic<int> signalling_{0};  // signal() calls not yet returned
  bool helpWanted_ = false;         // the waiter's pool has work that only a blocked worker can run
};

}  // namespace platform
