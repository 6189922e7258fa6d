// The HTTP server's task queue. cpp-httplib gives each connection a worker for its whole
// keep-alive life, so a fixed pool would let idle kept-alive connections starve new ones: this
// pool keeps a few workers and adds one whenever a task finds none idle, up to a limit (beyond
// it tasks wait). Workers block SIGPIPE: a peer that has gone turns a write into EPIPE, never a
// signal. shutdown() runs the queued tasks, then joins every worker.
#pragma once

#include <httplib.h>

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace devserver {

class WorkerPool final : public httplib::TaskQueue {
 public:
  WorkerPool(std::size_t initialWorkers, std::size_t maxWorkers);
  ~WorkerPool() override;

  void enqueue(std::function<void()> task) override;
  void shutdown() override;

 private:
  void spawnLocked();
  void run();

  const std::size_t maxWorkers_;
  std::mutex mutex_;
  std::condition_variable wake_;
  std::deque<std::function<void()>> tasks_;  // guarded by mutex_, as are the members below
  std::vector<std::thread> workers_;
  std::size_t idle_ = 0;
  bool stopping_ = false;
};

}  // namespace devserver
