#include "platform/dispatch/queue.h"

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <exception>
#include <mutex>
#include <utility>

#include "platform/dispatch/semaphore.h"
#include "platform/dispatch/worker_pool.h"

namespace platform {

namespace detail {

// The ordering behind a Queue. It outlives the Queue while work that it posted to its pool is still
// to run (that work holds it), so a queue dropped by its own work finishes in the background.
class QueueEngine : public std::enable_shared_from_this<QueueEngine> {
 public:
  QueueEngine(const Queue* owner, std::string label, WorkerPool& pool)
      : owner_(owner), label_(std::move(label)), pool_(pool) {}
  virtual ~QueueEngine() = default;

  virtual void submit(std::function<void()> work, bool barrier) = 0;
  // Runs `work` on the calling thread when the queue is idle; false when it is not.
  virtual bool runInline(std::function<void()>& work) = 0;
  // Waits until everything submitted so far (and whatever that submits) has run.
  virtual void waitIdle() = 0;

  const Queue* owner() const { return owner_.load(); }
  const std::string& label() const { return label_; }
  // Keeps a queue whose last reference its own work dropped until its work has all run, so that
  // the rest still runs as that queue's work.
  void adoptOrphan(Queue* queue) {
    std::lock_guard lock(mutex_);
    orphan_.reset(queue);
  }

 protected:
  void run(std::function<void()>& work) noexcept;
  // Called with mutex_ held once the queue has gone idle: wakes waiters, hands back the orphan to
  // delete outside the lock.
  std::unique_ptr<Queue> wentIdle() {
    idle_.notify_all();
    return std::move(orphan_);
  }

  std::atomic<const Queue*> owner_;
  const std::string label_;
  WorkerPool& pool_;
  std::mutex mutex_;
  std::condition_variable idle_;
  std::unique_ptr<Queue> orphan_;
};

}  // namespace detail

namespace {

thread_local const detail::QueueEngine* tCurrent = nullptr;

void report(const std::string& label, const char* what, const char* detail) noexcept {
  std::fprintf(stderr, "zlkad: queue \"%s\": %s%s\n", label.c_str(), what, detail);
}

// A programming error that would otherwise hang or corrupt the process.
[[noreturn]] void misuse(const std::string& label, const char* what, const char* detail = "") noexcept {
  report(label, what, detail);
  std::abort();
}

}  // namespace

namespace detail {

// Runs one item with the queue marked current. The item's captures are released here too, while
// the queue is still current, so that a last reference to the queue dropped with them is known to
// be dropped from inside.
void QueueEngine::run(std::function<void()>& work) noexcept {
  const QueueEngine* const outer = std::exchange(tCurrent, this);
  try {
    work();
  } catch (const std::exception& e) {
    report(label_, "work item threw: ", e.what());
    std::terminate();
  } catch (...) {
    report(label_, "work item threw a non-standard exception", "");
    std::terminate();
  }
  work = nullptr;
  tCurrent = outer;
}

namespace {

// One item at a time, in submission order. While items wait, one drain job on the pool runs them;
// it hands its worker back after a few items so that busy queues take turns.
class SerialEngine final : public QueueEngine {
 public:
  using QueueEngine::QueueEngine;

  void submit(std::function<void()> work, bool) override {
    {
      std::lock_guard lock(mutex_);
      items_.push_back(std::move(work));
      if (active_) return;
      active_ = true;
    }
    scheduleDrain();
  }

  bool runInline(std::function<void()>& work) override {
    {
      std::lock_guard lock(mutex_);
      if (active_) return false;
      active_ = true;
    }
    run(work);
    finishTurn();
    return true;
  }

  void waitIdle() override {
    std::unique_lock lock(mutex_);
    if (!active_) return;
    lock.unlock();
    WorkerPool::Blocking blocking;
    lock.lock();
    idle_.wait(lock, [this] { return !active_; });
  }

 private:
  static constexpr int kTurn = 8;

  void scheduleDrain() {
    try {
      pool_.post([self = std::static_pointer_cast<SerialEngine>(shared_from_this())] { self->drain(); });
    } catch (...) {
      // Out of memory for even the job: give the turn back so the next submit tries again.
      std::lock_guard lock(mutex_);
      active_ = false;
      idle_.notify_all();
      throw;
    }
  }

  void drain() {
    for (int i = 0; i < kTurn; ++i) {
      std::function<void()> work;
      {
        std::lock_guard lock(mutex_);
        if (items_.empty()) break;
        work = std::move(items_.front());
        items_.pop_front();
      }
      run(work);
    }
    finishTurn();
  }

  // Ends a drain or an inline run: the queue goes idle, or the waiting items get a drain job.
  void finishTurn() {
    std::unique_ptr<Queue> orphan;  // deleted on the way out, outside the lock
    bool more;
    {
      std::lock_guard lock(mutex_);
      more = !items_.empty();
      if (!more) {
        active_ = false;
        orphan = wentIdle();
      }
    }
    if (!more) return;
    try {
      scheduleDrain();
    } catch (...) {
      report(label_, "cannot schedule waiting work", "");
      std::terminate();
    }
  }

  std::deque<std::function<void()>> items_;
  bool active_ = false;  // a drain job is posted or running, or an item runs inline
};

// Up to `width` items at once. Items go straight to the pool until a barrier is submitted. From
// then on they are held back in order: the barrier starts once everything started before it has
// finished, and what follows it starts once the barrier has finished.
class ConcurrentEngine final : public QueueEngine {
 public:
  ConcurrentEngine(const Queue* owner, std::string label, WorkerPool& pool, unsigned width)
      : QueueEngine(owner, std::move(label), pool), width_(width) {}

  void submit(std::function<void()> work, bool barrier) override {
    std::lock_guard lock(mutex_);
    if (held_.empty() && !barrierRunning_ && started_ < width_ && (!barrier || started_ == 0))
      start(std::move(work), barrier);
    else
      held_.push_back({std::move(work), barrier});
  }

  bool runInline(std::function<void()>&) override { return false; }

  void waitIdle() override {
    std::unique_lock lock(mutex_);
    if (started_ == 0 && held_.empty()) return;
    lock.unlock();
    WorkerPool::Blocking blocking;
    lock.lock();
    idle_.wait(lock, [this] { return started_ == 0 && held_.empty(); });
  }

 private:
  struct Held {
    std::function<void()> work;
    bool barrier;
  };

  // Called with mutex_ held. Anything held back implies something started whose finish will start
  // it, so the queue never stalls while work is held back.
  void start(std::function<void()> work, bool barrier) {
    pool_.post([self = std::static_pointer_cast<ConcurrentEngine>(shared_from_this()), barrier,
                work = std::move(work)]() mutable {
      self->run(work);
      self->finished(barrier);
    });
    ++started_;
    barrierRunning_ = barrier;
  }

  void finished(bool barrier) {
    std::unique_ptr<Queue> orphan;  // deleted on the way out, outside the lock
    std::lock_guard lock(mutex_);
    --started_;
    if (barrier) barrierRunning_ = false;
    while (!held_.empty() && !barrierRunning_ && started_ < width_) {
      Held& next = held_.front();
      if (next.barrier && started_ != 0) break;
      try {
        start(std::move(next.work), next.barrier);
      } catch (...) {
        report(label_, "cannot schedule held work", "");
        std::terminate();
      }
      held_.pop_front();
    }
    if (started_ == 0 && held_.empty()) orphan = wentIdle();
  }

  const unsigned width_;
  std::deque<Held> held_;
  unsigned started_ = 0;  // posted to the pool and not yet finished
  bool barrierRunning_ = false;
};

}  // namespace
}  // namespace detail

std::shared_ptr<Queue> Queue::serial(std::string label, WorkerPool* pool) {
  return std::shared_ptr<Queue>(new Queue(std::move(label), true, 1, pool ? *pool : WorkerPool::shared()),
                                &Queue::release);
}

std::shared_ptr<Queue> Queue::concurrent(std::string label, unsigned width, WorkerPool* pool) {
  if (width == 0) misuse(label, "concurrent", " with width 0 could never run its work");
  return std::shared_ptr<Queue>(new Queue(std::move(label), false, width, pool ? *pool : WorkerPool::shared()),
                                &Queue::release);
}

Queue::Queue(std::string label, bool serial, unsigned width, WorkerPool& pool)
    : label_(std::move(label)), serial_(serial) {
  if (serial_)
    engine_ = std::make_shared<detail::SerialEngine>(this, label_, pool);
  else
    engine_ = std::make_shared<detail::ConcurrentEngine>(this, label_, pool, width);
}

Queue::~Queue() = default;

void Queue::release(Queue* queue) noexcept {
  // Dropped by its own work, the queue lives on until the rest of its work has run; otherwise the
  // dropper waits for all of it.
  if (queue->isCurrent()) {
    queue->engine_->adoptOrphan(queue);
    return;
  }
  queue->engine_->waitIdle();
  delete queue;
}

const Queue* Queue::current() noexcept { return tCurrent ? tCurrent->owner() : nullptr; }

void Queue::async(std::function<void()> work) { submit(std::move(work), false); }

void Queue::barrierAsync(std::function<void()> work) { submit(std::move(work), !serial_); }

void Queue::sync(std::function<void()> work) { submitAndWait(std::move(work), false, "sync"); }

void Queue::barrierSync(std::function<void()> work) { submitAndWait(std::move(work), !serial_, "barrierSync"); }

void Queue::submit(std::function<void()> work, bool barrier) {
  if (!work) misuse(label_, "empty work item submitted");
  engine_->submit(std::move(work), barrier);
}

void Queue::submitAndWait(std::function<void()> work, bool barrier, const char* operation) {
  if (!work) misuse(label_, "empty work item submitted to ", operation);
  if (isCurrent()) {
    // Even on a concurrent queue: the item would queue behind any barrier that waits for us.
    misuse(label_, operation, " called from this queue's own work would wait for itself");
  }
  // An idle serial queue runs the work right here, as its own: no hand-off, no wake-up. The
  // engine is held, since the work may drop the last reference to this queue.
  std::shared_ptr<detail::QueueEngine> engine = engine_;
  if (engine->runInline(work)) return;
  Semaphore done;
  engine_->submit(
      [&work, &done] {
        work();
        done.signal();
      },
      barrier);
  done.wait();
}

}  // namespace platform
