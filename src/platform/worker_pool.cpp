#include "platform/worker_pool.h"

#include <malloc.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
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
  std::lock_guard lock(mutex_);
  jobs_.push_back(std::move(job));
  if (idle_ > 0)
    available_.notify_one();
  else
    growIfNeeded();
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

WorkerPool& WorkerPool::shared() {
  static WorkerPool* pool = new WorkerPool("shared", {.minimum = 1, .maximum = 64});
  return *pool;
}

WorkerPool& WorkerPool::connections() {
  static WorkerPool* pool = new WorkerPool("connections", {.minimum = 2, .maximum = 64});
  return *pool;
}

void WorkerPool::growIfNeeded() {
  // Work waits and fewer workers than the minimum are free to take it: only blocked workers (or
  // workers that could not be started) make that so.
  bool waiting = jobs_.size() > idle_;
  if (waiting && threads_ - blocked_ < limits_.minimum && threads_ < limits_.maximum) startWorker();
}

bool WorkerPool::startWorker() {
  ++threads_;
  try {
    std::thread([this] { work(); }).detach();
    return true;
  } catch (const std::system_error&) {
    --threads_;
    ++startFailures_;
    return false;
  }
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

void WorkerPool::setBlocked(bool blocked) {
  std::lock_guard lock(mutex_);
  if (blocked) {
    ++blocked_;
    growIfNeeded();
  } else {
    --blocked_;
  }
}

WorkerPool::Blocking::Blocking() : pool_(tPool) {
  if (pool_) pool_->setBlocked(true);
}

WorkerPool::Blocking::~Blocking() {
  if (pool_) pool_->setBlocked(false);
}

}  // namespace platform
