#pragma once

// Work queues: every object that needs its own ordering of work owns one.
//
// A serial queue runs one item at a time, in submission order, on a thread of its own. A
// concurrent queue runs up to `width` items at once on threads of its own; barrier items on it
// run alone, after everything submitted before them and before anything submitted after them.
// Because no queue shares threads with another, a queue whose work blocks for a long time
// delays nothing but itself.
//
// async() never blocks. sync() and barrierSync() wait until the work has run; calling them from
// work running on the same queue is a programming error (it would wait for itself) and aborts.
// An exception escaping a work item is reported on stderr with the queue's label and then
// terminates the process: the submitter has long gone and nobody else could handle it.
//
// Queues live in shared_ptrs. Dropping the last reference runs everything already submitted,
// then stops the queue's threads; it waits for that, unless the reference is dropped by the
// queue's own work, in which case the queue finishes and winds down in the background.

#include <functional>
#include <memory>
#include <string>

namespace platform {

namespace detail {
class QueueEngine;
}

class Queue {
 public:
  static std::shared_ptr<Queue> serial(std::string label);
  // Throws std::invalid_argument if `width` is 0.
  static std::shared_ptr<Queue> concurrent(std::string label, unsigned width = 4);

  Queue(const Queue&) = delete;
  Queue& operator=(const Queue&) = delete;
  ~Queue();

  const std::string& label() const noexcept { return label_; }
  bool isSerial() const noexcept { return serial_; }

  // Each throws std::invalid_argument if `work` is empty.
  void async(std::function<void()> work);
  void sync(std::function<void()> work);
  // On a serial queue these are async() and sync().
  void barrierAsync(std::function<void()> work);
  void barrierSync(std::function<void()> work);

  // Whether the calling thread is running work of this queue.
  bool isCurrent() const noexcept { return current() == this; }
  // The queue whose work the calling thread is running, or null.
  static const Queue* current() noexcept;

 private:
  Queue(std::string label, bool serial, unsigned width);
  static void release(Queue* queue) noexcept;
  void submit(std::function<void()> work, bool barrier);
  void submitAndWait(std::function<void()> work, bool barrier, const char* operation);

  std::string label_;
  bool serial_;
  std::unique_ptr<detail::QueueEngine> engine_;
};

}  // namespace platform
