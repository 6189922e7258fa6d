// LoopMailbox: work handed from any thread to the one thread that runs an sd-event loop. sd-bus and
// sd-event objects belong to that thread, so every other thread reaches them through a mailbox.
//
// Work runs on the loop's thread in the order it was posted. A post that cannot be queued (the
// mailbox is closed, or memory ran out) is refused and says so, so that the poster can answer for
// the work itself instead of losing it. close() refuses later posts and ends the loop once what was
// already posted has run; drain() runs, on the loop's thread after the loop has returned, whatever
// was posted but never reached the loop. Work that throws is logged and the rest still runs.
#pragma once

#include <systemd/sd-event.h>

#include <functional>
#include <mutex>
#include <vector>

#include "platform/bus/handles.h"

namespace platform {

class LoopMailbox {
 public:
  using Work = std::function<void()>;

  LoopMailbox() = default;
  ~LoopMailbox();
  LoopMailbox(const LoopMailbox&) = delete;
  LoopMailbox& operator=(const LoopMailbox&) = delete;

  // attach watches a new eventfd on `event` (borrowed; the mailbox's event source keeps its own
  // reference). It returns zero, or a negative errno and leaves the mailbox unattached. Call it once,
  // before any post.
  int attach(sd_event* event);

  // post queues `work` for the loop's thread, from any thread, and wakes the loop if it may be
  // asleep. It returns true when the work will run (by the loop, or by drain()), false when the
  // mailbox is unattached or closed or memory ran out (logged); the work is then dropped unrun.
  bool post(Work work) noexcept;

  // close refuses every later post and ends the attached loop once the work already posted has
  // run; from any thread. It returns false when the mailbox was already closed.
  bool close() noexcept;

  // isClosed answers whether posts are refused from now on; from any thread.
  bool isClosed() const;

  // drain closes the mailbox and runs, on the calling thread, the work that was posted but has not
  // run. Call it on the loop's thread once the loop has returned.
  void drain() noexcept;

 private:
  static int onWake(sd_event_source* source, int fd, uint32_t events, void* userdata) noexcept;
  static void run(std::vector<Work>& work) noexcept;

  UniqueFd wakeFd_;
  EventSourcePtr source_;
  mutable std::mutex mutex_;  // guards queue_ and closed_
  std::vector<Work> queue_;
  bool closed_ = false;
  std::vector<Work> taken_;  // the loop's thread only: what one wake runs, swapped with queue_
};

}  // namespace platform
