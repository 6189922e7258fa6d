// WorkerPool: the threads that queues run their work on. A queue is an ordering, not a thread:
// serial and concurrent queues hand their work to a pool, and any number of queues share one.
//
// A pool keeps `minimum` workers. It starts another only while no worker is free and at least one
// of its workers is blocked (waiting on a Semaphore inside a work item), up to `maximum`: a pool
// whose work never blocks stays at its minimum, and one whose workers all wait for something still
// makes progress. Workers above the minimum end after `idleTimeout` without work. When a thread
// cannot be started (a task limit, memory), the work waits for a worker that exists: a shortage of
// threads delays work, it never fails it and never throws. In a pool that helps, a worker blocked
// on a Semaphore meanwhile runs the waiting work itself, one job at a time between looks at its
// own semaphore, so work that waits for other work of its own pool still ends without a new thread.
// Helping nests a job on the waiter's stack, so it is safe only in a pool whose work waits solely
// on work that never waits (a nested job then always returns): the shared pool's work is so, the
// connections' is not (a caller's work holds a connection claim while it waits, and another
// caller's work nested on top of it could wait for that claim for ever).
//
// The daemon has two pools: shared() for its own queues (the secure-association session's, the HTTP
// sessions' callbacks), and connections() for the peers' queues, whose work may block for minutes
// on a session opening; so blocked connection work can never starve the session or HTTP callbacks.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

namespace platform {

class WorkerPool {
 public:
  struct Limits {
    unsigned minimum = 1;
    unsigned maximum = 64;
    std::chrono::milliseconds idleTimeout{5000};
    bool helpWhileBlocked = false;  // see above: only for work that waits on work that never waits
  };

  // Starts the minimum of workers, as many as the system allows.
  WorkerPool(std::string name, Limits limits);
  // Runs everything posted (and whatever that posts), then joins the workers. Must not be called
  // from one of them.
  ~WorkerPool();
  WorkerPool(const WorkerPool&) = delete;
  WorkerPool& operator=(const WorkerPool&) = delete;

  // post runs `job` on a worker, in the order posted among jobs that wait. It fails only by
  // throwing std::bad_alloc, when the job cannot be stored.
  void post(std::function<void()> job);
  // setMaximum changes how many workers the pool may grow to (at least its minimum).
  void setMaximum(unsigned maximum);

  // name is the name given at construction, borrowed from the pool.
  const std::string& name() const { return name_; }
  // threads counts the workers alive now.
  size_t threads() const;
  // threadStartFailures counts the workers that could not be started since the pool was made.
  size_t threadStartFailures() const;
  // refuseThreadStarts makes every start of a worker fail, as if the system had no thread to give,
  // while `refuse` holds (tests).
  void refuseThreadStarts(bool refuse);

  // shared is the pool of the daemon's own queues, made on first use; never destroyed, since its
  // workers may still be blocked at exit.
  static WorkerPool& shared();
  // connections is the pool of the peers' queues, made on first use and never destroyed likewise.
  static WorkerPool& connections();

  // What a blocked worker of a helping pool waits on: the pool calls wakeToHelp() (with the pool's
  // lock held, so it must take no lock but its own) when work waits that no worker can take.
  class HelpWaker {
   public:
    // wakeToHelp wakes the blocked worker so that it calls Blocking::help(); it must not block.
    virtual void wakeToHelp() = 0;

   protected:
    ~HelpWaker() = default;
  };

  // Marks the calling thread, if it is a worker of a pool, as blocked while the object lives; with
  // a `waker`, a helping pool wakes it when there is work to help with.
  class Blocking {
   public:
    // Blocking marks the thread blocked, and registers `waker` (borrowed for the object's life) with
    // a helping pool; on a thread that is no pool's worker it does nothing.
    explicit Blocking(HelpWaker* waker = nullptr);
    ~Blocking();
    Blocking(const Blocking&) = delete;
    Blocking& operator=(const Blocking&) = delete;

    // helps tells whether the blocked thread is a worker of a helping pool with a waker.
    bool helps() const;
    // help runs one job that waits with no worker to take it, and returns true; it returns false
    // when there is none, when a new worker could take it, or when the thread does not help.
    bool help();

   private:
    WorkerPool* pool_;
    HelpWaker* waker_;
  };

 private:
  void work();
  // All called with mutex_ held.
  bool starved() const;
  void growIfNeeded();
  bool startWorker();
  void setBlocked(bool blocked, HelpWaker* waker);
  void callHelpers();

  const std::string name_;
  mutable std::mutex mutex_;
  std::condition_variable available_;  // a job was posted, or the pool is shutting down
  std::condition_variable ended_;      // a worker ended
  Limits limits_;
  std::deque<std::function<void()>> jobs_;
  size_t threads_ = 0;
  size_t idle_ = 0;     // waiting for a job
  size_t blocked_ = 0;  // running a job that waits for something
  size_t startFailures_ = 0;
  bool stopping_ = false;
  bool refuseStarts_ = false;
  std::vector<HelpWaker*> helpers_;  // blocked workers that would help, innermost wait last
};

}  // namespace platform
