// The execution library's handler fences are invisible to the thread sanitizer, which GCC warns
// about; the queue's ordering never rests on them (every hand-off also goes through a mutex).
#if defined(__SANITIZE_THREAD__) && !defined(__clang__)
#pragma GCC diagnostic ignored "-Wtsan"
#endif

#include "platform/queue.h"

#include <asio/post.hpp>
#include <asio/strand.hpp>
#include <asio/thread_pool.hpp>

#include <cstdio>
#include <cstdlib>
#include <deque>
#include <exception>
#include <mutex>
#include <stdexcept>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/semaphore.h"

namespace platform {

namespace {

thread_local const Queue* tCurrent = nullptr;

void report(const Queue& queue, const char* what, const char* detail) noexcept {
  std::fprintf(stderr, "zlkad: queue \"%s\": %s%s\n", queue.label().c_str(), what, detail);
}

// A programming error that would otherwise hang or corrupt the process.
[[noreturn]] void misuse(const Queue& queue, const char* what, const char* detail = "") noexcept {
  report(queue, what, detail);
  std::abort();
}

// Runs one item with the queue marked current. The item's captures are released here too, while
// the queue is still current, so that a last reference to the queue dropped with them is known to
// be dropped from inside.
void runItem(const Queue& queue, std::function<void()>& work) noexcept {
  const Queue* const outer = std::exchange(tCurrent, &queue);
  try {
    work();
  } catch (const std::exception& e) {
    report(queue, "work item threw: ", e.what());
    std::terminate();
  } catch (...) {
    report(queue, "work item threw a non-standard exception", "");
    std::terminate();
  }
  work = nullptr;
  tCurrent = outer;
}

}  // namespace

namespace detail {

class QueueEngine {
 public:
  virtual ~QueueEngine() = default;
  virtual void submit(std::function<void()> work, bool barrier) = 0;
  // Runs everything submitted so far (and whatever that submits), then stops the threads.
  // Must not be called from one of them.
  virtual void drain() = 0;
};

namespace {

// A strand, not the pool's own queue, keeps the order: a one-thread pool defers work that its
// own thread posts until the running item returns, which would let work posted meanwhile by
// other threads overtake it.
class SerialEngine final : public QueueEngine {
 public:
  explicit SerialEngine(const Queue& owner) : owner_(owner) {}

  void submit(std::function<void()> work, bool) override {
    asio::post(strand_, [&owner = owner_, work = std::move(work)]() mutable { runItem(owner, work); });
  }

  void drain() override { pool_.join(); }

 private:
  const Queue& owner_;
  asio::thread_pool pool_{1};
  asio::strand<asio::thread_pool::executor_type> strand_{asio::make_strand(pool_)};
};

// Items go straight to the pool until a barrier is submitted. From then on they are held back in
// order: the barrier starts once everything started before it has finished, and what follows it
// starts once the barrier has finished.
class ConcurrentEngine final : public QueueEngine {
 public:
  ConcurrentEngine(const Queue& owner, unsigned width) : owner_(owner), pool_(width) {}

  void submit(std::function<void()> work, bool barrier) override {
    std::lock_guard lock(mutex_);
    if (held_.empty() && !barrierRunning_ && (!barrier || started_ == 0)) {
      start(std::move(work), barrier);
    } else {
      held_.push_back({std::move(work), barrier});
    }
  }

  void drain() override { pool_.join(); }

 private:
  struct Held {
    std::function<void()> work;
    bool barrier;
  };

  // Called with mutex_ held. Anything held back implies something started whose finish will
  // start it, so the pool never runs dry while work is held back, and drain() misses nothing.
  void start(std::function<void()> work, bool barrier) {
    ++started_;
    barrierRunning_ = barrier;
    asio::post(pool_, [this, barrier, work = std::move(work)]() mutable {
      runItem(owner_, work);
      finished(barrier);
    });
  }

  void finished(bool barrier) {
    std::lock_guard lock(mutex_);
    --started_;
    if (barrier) barrierRunning_ = false;
    while (!held_.empty() && !barrierRunning_) {
      Held& next = held_.front();
      if (next.barrier && started_ != 0) break;
      start(std::move(next.work), next.barrier);
      held_.pop_front();
    }
  }

  const Queue& owner_;
  asio::thread_pool pool_;
  std::mutex mutex_;
  std::deque<Held> held_;
  unsigned started_ = 0;  // posted to the pool and not yet finished
  bool barrierRunning_ = false;
};

}  // namespace
}  // namespace detail

std::shared_ptr<Queue> Queue::serial(std::string label) {
  return std::shared_ptr<Queue>(new Queue(std::move(label), true, 1), &Queue::release);
}

std::shared_ptr<Queue> Queue::concurrent(std::string label, unsigned width) {
  if (width == 0) throw std::invalid_argument("Queue::concurrent: width must be at least 1");
  return std::shared_ptr<Queue>(new Queue(std::move(label), false, width), &Queue::release);
}

Queue::Queue(std::string label, bool serial, unsigned width)
    : label_(std::move(label)), serial_(serial) {
  if (serial_) {
    engine_ = std::make_unique<detail::SerialEngine>(*this);
  } else {
    engine_ = std::make_unique<detail::ConcurrentEngine>(*this, width);
  }
}

Queue::~Queue() {
  if (isCurrent()) misuse(*this, "destroyed by its own work outside its shared_ptr");
  engine_->drain();
}

void Queue::release(Queue* queue) noexcept {
  if (!queue->isCurrent()) {
    delete queue;
    return;
  }
  // A thread cannot wait for itself to finish: let another one drain the queue and join it.
  try {
    std::thread([queue] { delete queue; }).detach();
  } catch (const std::system_error& e) {
    report(*queue, "cannot start a thread to wind down the queue: ", e.what());
    std::terminate();
  }
}

const Queue* Queue::current() noexcept { return tCurrent; }

void Queue::async(std::function<void()> work) { submit(std::move(work), false); }

void Queue::barrierAsync(std::function<void()> work) { submit(std::move(work), !serial_); }

void Queue::sync(std::function<void()> work) { submitAndWait(std::move(work), false, "sync"); }

void Queue::barrierSync(std::function<void()> work) {
  submitAndWait(std::move(work), !serial_, "barrierSync");
}

void Queue::submit(std::function<void()> work, bool barrier) {
  if (!work) throw std::invalid_argument("Queue: empty work item");
  engine_->submit(std::move(work), barrier);
}

void Queue::submitAndWait(std::function<void()> work, bool barrier, const char* operation) {
  if (!work) throw std::invalid_argument("Queue: empty work item");
  if (isCurrent()) {
    // Even on a concurrent queue: the item would queue behind any barrier that waits for us.
    misuse(*this, operation, " called from this queue's own work would wait for itself");
  }
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
