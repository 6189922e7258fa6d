#pragma once

// Counting semaphore for handing a result from one thread to a waiting one.
//
// signal() adds one and wakes a waiter; wait() takes one, blocking until there is one;
// waitFor()/waitUntil() give up at a deadline and then return false, taking nothing. A signal
// that arrives after a timed-out wait simply stays in the count. The count saturates instead of
// overflowing, so signals without waits never fail or block. Safe to destroy as soon as the last
// wait has returned, even while the signalling thread is still leaving signal().

#include <chrono>
#include <condition_variable>
#include <mutex>

namespace platform {

class Semaphore {
 public:
  // Throws std::invalid_argument if `value` is negative.
  explicit Semaphore(long value = 0);
  Semaphore(const Semaphore&) = delete;
  Semaphore& operator=(const Semaphore&) = delete;

  void signal();
  void wait();
  // True if a signal was taken before the deadline; a zero or negative timeout only polls.
  bool waitFor(std::chrono::nanoseconds timeout);
  bool waitUntil(std::chrono::steady_clock::time_point deadline);

 private:
  std::mutex mutex_;
  std::condition_variable available_;
  long count_;
};

}  // namespace platform
