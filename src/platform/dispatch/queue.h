#pragma once

// Work queues: every object that needs its own ordering of work owns one.
//
// A queue is an ordering, not a thread: its work runs on the workers of a WorkerPool that many
// queues share (the shared pool unless another is given). A serial queue runs one item at a time,
// in submission order. A concurrent queue runs up to `width` items at once; barrier items on it run
// alone, after everything submitted before them and before anything submitted after them.
//
// async() never blocks and costs at most one wake-up of a worker. sync() and barrierSync() wait
// until the work has run; on an idle serial queue, sync() runs the work right away on the calling
// thread, with the queue marked current. Calling them from work running on the same queue is a
// programming error (it would wait for itself) and aborts. An exception escaping a work item is
// reported on stderr with the queue's label and then terminates the process: the submitter has
// long gone and nobody else could handle it.
//
// Queues live in shared_ptrs. Dropping the last reference waits until everything already
// submitted has run, unless the reference is dropped by the queue's own work, in which case the
// rest of its work still runs, in the background.

#include <functional>
#include <memory>
#include <string>

namespace platform {

class WorkerPool;
namespace detail {
class QueueEngine;
}

class Queue {
 public:
  // serial makes a serial queue whose work runs on `pool` (WorkerPool::shared() when null).
  static std::shared_ptr<Queue> serial(std::string label, WorkerPool* pool = nullptr);
  // concurrent makes a concurrent queue of `width`; it aborts if `width` is 0 (a programming error).
  static std::shared_ptr<Queue> concurrent(std::string label, unsigned width = 4, WorkerPool* pool = nullptr);

  Queue(const Queue&) = delete;
  Queue& operator=(const Queue&) = delete;
  ~Queue();

  // label is the name given at creation, borrowed from the queue (thread names, log lines).
  const std::string& label() const noexcept { return label_; }
  // isSerial is true for a queue made by serial().
  bool isSerial() const noexcept { return serial_; }

  // async submits `work` and returns at once; the queue keeps `work` until it has run. It aborts
  // if `work` is empty (a programming error).
  void async(std::function<void()> work);
  // sync submits `work` and returns once it has run; it aborts if `work` is empty or when called
  // from this queue's own work.
  void sync(std::function<void()> work);
  // barrierAsync is async() for a barrier item: on a concurrent queue it runs alone; on a serial
  // queue it is async().
  void barrierAsync(std::function<void()> work);
  // barrierSync is sync() for a barrier item; on a serial queue it is sync().
  void barrierSync(std::function<void()> work);

  // isCurrent is true when the calling thread is running work of this queue.
  bool isCurrent() const noexcept { return current() == this; }
  // current is the queue whose work the calling thread is running, or null; not owned.
  static const Queue* current() noexcept;

 private:
  Queue(std::string label, bool serial, unsigned width, WorkerPool& pool);
  static void release(Queue* queue) noexcept;
  void submit(std::function<void()> work, bool barrier);
  void submitAndWait(std::function<void()> work, bool barrier, const char* operation);

  std::string label_;
  bool serial_;
  std::shared_ptr<detail::QueueEngine> engine_;
};

}  // namespace platform
