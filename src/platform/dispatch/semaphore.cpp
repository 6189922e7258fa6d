#include "platform/dispatch/semaphore.h"

#include <cstdio>
#include <cstdlib>
#include <limits>
#include <thread>

#include "platform/dispatch/worker_pool.h"

namespace platform {

Semaphore::Semaphore(long value) : count_(value) {
  if (value < 0) {
    std::fprintf(stderr, "zlkad: semaphore made with a negative count (%ld)\n", value);
    std::abort();
  }
}

Semaphore::~Semaphore() {
  // A waiter may return, and its owner destroy this, while a signaller is still leaving signal().
  while (signalling_.load(std::memory_order_acquire) != 0) std::this_thread::yield();
}

void Semaphore::signal() {
  signalling_.fetch_add(1, std::memory_order_acq_rel);
  {
    std::lock_guard lock(mutex_);
    if (count_ < std::numeric_limits<long>::max()) ++count_;
  }
  // Notified after the lock is let go: a waiter woken under it would at once sleep again on it.
  available_.notify_one();
  signalling_.fetch_sub(1, std::memory_order_release);
}

void Semaphore::wait() { take(std::nullopt); }

bool Semaphore::waitFor(std::chrono::nanoseconds timeout) {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point now = Clock::now();
  // A timeout past the clock's range is no deadline at all; adding it would overflow.
  if (timeout > Clock::time_point::max() - now) {
    wait();
    return true;
  }
  return waitUntil(now + std::chrono::duration_cast<Clock::duration>(timeout));
}

bool Semaphore::waitUntil(std::chrono::steady_clock::time_point deadline) { return take(deadline); }

// Taking a signal that is already there tells no pool anything. A blocked worker of a helping pool
// looks for work to help with once before it first sleeps, then whenever its pool asks or its last
// look ran a job; its own signal and deadline are checked between jobs, so it never runs more than
// one job past them.
bool Semaphore::take(std::optional<std::chrono::steady_clock::time_point> deadline) {
  using Clock = std::chrono::steady_clock;
  std::unique_lock lock(mutex_);
  if (count_ > 0) {
    --count_;
    return true;
  }
  if (deadline && *deadline <= Clock::now()) return false;
  lock.unlock();
  WorkerPool::Blocking blocking(this);
  const bool helper = blocking.helps();
  lock.lock();
  bool look = helper;
  while (count_ == 0) {
    if (helper && (look || helpWanted_)) {
      helpWanted_ = false;
      lock.unlock();
      look = blocking.help();
      lock.lock();
      if (deadline && Clock::now() >= *deadline) break;
    } else if (!deadline) {
      available_.wait(lock);
    } else if (available_.wait_until(lock, *deadline) == std::cv_status::timeout && count_ == 0 &&
               !(helper && helpWanted_)) {
      break;
    }
  }
  const bool taken = count_ > 0;
  if (taken) --count_;
  // `blocking` ends after this and takes its pool's lock, which must never be taken under ours:
  // the pool wakes helpers with its lock held.
  lock.unlock();
  return taken;
}

void Semaphore::wakeToHelp() {
  std::lock_guard lock(mutex_);
  helpWanted_ = true;
  available_.notify_all();
}

}  // namespace platform
