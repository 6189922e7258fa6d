#include "devserver/worker_pool.h"

#include <pthread.h>
#include <signal.h>

#include <algorithm>

namespace devserver {

WorkerPool::WorkerPool(std::size_t initialWorkers, std::size_t maxWorkers)
    : maxWorkers_(std::max<std::size_t>(1, maxWorkers)) {
  std::lock_guard lock(mutex_);
  for (std::size_t i = 0; i < std::min(initialWorkers, maxWorkers_); ++i) {
    spawnLocked();
  }
}

WorkerPool::~WorkerPool() { shutdown(); }

void WorkerPool::spawnLocked() {
  workers_.emplace_back([this] { run(); });
}

void WorkerPool::enqueue(std::function<void()> task) {
  std::lock_guard lock(mutex_);
  tasks_.push_back(std::move(task));
  if (idle_ < tasks_.size() && workers_.size() < maxWorkers_) {
    spawnLocked();
  }
  wake_.notify_one();
}

void WorkerPool::shutdown() {
  std::vector<std::thread> workers;
  {
    std::lock_guard lock(mutex_);
    stopping_ = true;
    workers.swap(workers_);
  }
  wake_.notify_all();
  for (std::thread& worker : workers) {
    worker.join();
  }
}

void WorkerPool::run() {
  sigset_t pipe;
  sigemptyset(&pipe);
  sigaddset(&pipe, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipe, nullptr);

  std::unique_lock lock(mutex_);
  for (;;) {
    ++idle_;
    wake_.wait(lock, [this] { return stopping_ || !tasks_.empty(); });
    --idle_;
    if (tasks_.empty()) {
      return;  // stopping, and nothing left to run
    }
    std::function<void()> task = std::move(tasks_.front());
    tasks_.pop_front();
    lock.unlock();
    task();
    lock.lock();
  }
}

}  // namespace devserver
