#include "platform/dispatch/worker_pool.h"

#include <malloc.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <system_error>
#include <thread>

namespace platform {

namespace {
thread_local WorkerPool* tPool = nullptr;
}

WorkerPool::WorkerPool(std::string name, Limits limits) : name_(std::move(name)), limits_(limits) {
  if (limits_.maximum < limits_.minimum) limits_.maximum = limits_.minimum;
  std::lock_guard lock(mutex_);
  for (unsigned i = 0; i < limits_.minimum; ++i) startWorker();
}

WorkerPool::~WorkerPool() {
  if (tPool == this) {
    std::fprintf(stderr, "zlkad: worker pool \"%s\" destroyed by its own worker\n", name_.c_str());
    std::abort();
  }
  std::unique_lock lock(mutex_);
  stopping_ = true;
  available_.notify_all();
  ended_.wait(lock, [this] { return threads_ == 0; });
}

void WorkerPool::post(std::function<void()> job) {
  std::unique_lock lock(mutex_);
  jobs_.push_back(std::move(job));
  if (idle_ > 0) {
    // Notified after the lock is let go: a worker woken under it would at once sleep again on it.
    lock.unlock();
    available_.notify_one();
  } else {
    growIfNeeded();
    callHelpers();
  }
}

void WorkerPool::setMaximum(unsigned maximum) {
  std::lock_guard lock(mutex_);
  limits_.maximum = std::max(maximum, limits_.minimum);
}

size_t WorkerPool::threads() const {
  std::lock_guard lock(mutex_);
  return threads_;
}

size_t WorkerPool::threadStartFailures() const {
  std::lock_guard lock(mutex_);
  return startFailures_;
}

void WorkerPool::refuseThreadStarts(bool refuse) {
  std::lock_guard lock(mutex_);
  refuseStarts_ = refuse;
}

WorkerPool& WorkerPool::shared() {
  // Its blocking work (an HTTP callback verifying an answer) waits only on the session's queues,
  // whose work never waits: it may help.
  static WorkerPool* pool = new WorkerPool("shared", {.minimum = 1, .maximum = 64, .helpWhileBlocked = true});
  return *pool;
}

WorkerPool& WorkerPool::connections() {
  static WorkerPool* pool = new WorkerPool("connections", {.minimum = 2, .maximum = 64});
  return *pool;
}

// Work waits and fewer workers than the minimum are free to take it: only blocked workers (or
// workers that could not be started) make that so.
bool WorkerPool::starved() const {
  return jobs_.size() > idle_ && threads_ - blocked_ < limits_.minimum && threads_ < limits_.maximum;
}

void WorkerPool::growIfNeeded() {
  if (starved()) startWorker();
}

bool WorkerPool::startWorker() {
  if (!refuseStarts_) {
    ++threads_;
    try {
      std::thread([this] { work(); }).detach();
      return true;
    } catch (const std::system_error&) {
      --threads_;
    }
  }
  ++startFailures_;
  return false;
}

// Still starved once growing has been tried: no thread could be started, and the blocked workers
// are the only ones left to run the work.
void WorkerPool::callHelpers() {
  if (!limits_.helpWhileBlocked || !starved()) return;
  for (HelpWaker* helper : helpers_) helper->wakeToHelp();
}

void WorkerPool::work() {
  tPool = this;
  std::unique_lock lock(mutex_);
  for (;;) {
    if (jobs_.empty()) {
      if (stopping_) break;
      ++idle_;
      bool posted = available_.wait_for(lock, limits_.idleTimeout, [this] { return !jobs_.empty() || stopping_; });
      --idle_;
      if (!posted && threads_ - blocked_ > limits_.minimum) break;
      continue;
    }
    std::function<void()> job = std::move(jobs_.front());
    jobs_.pop_front();
    lock.unlock();
    job();
    job = nullptr;  // its captures go outside the lock too
    lock.lock();
  }
  --threads_;
  // The last worker that a burst added gives back what the burst left free in the allocator's
  // arenas; without this a daemon keeps the memory of its busiest moment for good.
  bool trim = threads_ == limits_.minimum && !stopping_;
  ended_.notify_all();
  lock.unlock();
  if (trim) malloc_trim(0);
}

void WorkerPool::setBlocked(bool blocked, HelpWaker* waker) {
  std::lock_guard lock(mutex_);
  if (blocked) {
    ++blocked_;
    if (waker && limits_.helpWhileBlocked) helpers_.push_back(waker);
    growIfNeeded();
    callHelpers();
  } else {
    --blocked_;
    // The same semaphore may be waited on by two workers: take away one registration of it.
    auto it = std::find(helpers_.rbegin(), helpers_.rend(), waker);
    if (it != helpers_.rend()) helpers_.erase(std::next(it).base());
  }
}

WorkerPool::Blocking::Blocking(HelpWaker* waker) : pool_(tPool), waker_(waker) {
  if (pool_) pool_->setBlocked(true, waker_);
}

WorkerPool::Blocking::~Blocking() {
  if (pool_) pool_->setBlocked(false, waker_);
}

// The job runs as the worker's own would, in the order posted, outside the lock; the worker counts
// as free meanwhile, so that a job it nests may block and be helped in turn.
bool WorkerPool::Blocking::helps() const { return pool_ && waker_ && pool_->limits_.helpWhileBlocked; }

bool WorkerPool::Blocking::help() {
  if (!helps()) return false;
  std::unique_lock lock(pool_->mutex_);
  if (!pool_->starved() || pool_->startWorker()) return false;
  std::function<void()> job = std::move(pool_->jobs_.front());
  pool_->jobs_.pop_front();
  --pool_->blocked_;
  lock.unlock();
  job();
  job = nullptr;
  lock.lock();
  ++pool_->blocked_;
  return true;
}

}  // namespace platform
