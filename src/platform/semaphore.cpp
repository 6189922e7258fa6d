#include "platform/semaphore.h"

#include <limits>
#include <optional>
#include <stdexcept>

#include "platform/worker_pool.h"

namespace platform {

Semaphore::Semaphore(long value) : count_(value) {
  if (value < 0) throw std::invalid_argument("Semaphore: negative initial value");
}

void Semaphore::signal() {
  std::lock_guard lock(mutex_);
  if (count_ < std::numeric_limits<long>::max()) ++count_;
  // Notified under the lock: a waiter cannot return, and destroy this object, until we let go.
  available_.notify_one();
}

// A worker of a pool that waits here tells its pool, so that the pool may start another worker
// meanwhile; taking a signal that is already there costs nothing of the kind.
void Semaphore::wait() {
  std::optional<WorkerPool::Blocking> blocking;
  std::unique_lock lock(mutex_);
  if (count_ == 0) {
    lock.unlock();
    blocking.emplace();
    lock.lock();
  }
  available_.wait(lock, [this] { return count_ > 0; });
  --count_;
}

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

bool Semaphore::waitUntil(std::chrono::steady_clock::time_point deadline) {
  std::optional<WorkerPool::Blocking> blocking;
  std::unique_lock lock(mutex_);
  if (count_ == 0 && deadline > std::chrono::steady_clock::now()) {
    lock.unlock();
    blocking.emplace();
    lock.lock();
  }
  if (!available_.wait_until(lock, deadline, [this] { return count_ > 0; })) return false;
  --count_;
  return true;
}

}  // namespace platform
