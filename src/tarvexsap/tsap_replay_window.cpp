#include "tarvexsap/tsap_replay_window.h"

namespace tsap {

bool ReplayWindow::accept(uint64_t seq) {
  if (seq == 0) {
    return false;
  }
  if (seq > highest_) {
    const uint64_t advance = seq - highest_;
    if (advance >= kReplayWindow) {
      seen_.reset();
    } else {
      // Slots of the numbers entering the window still hold the ones leaving it.
      for (uint64_t s = highest_ + 1; s <= seq; ++s) {
        seen_.reset(s % kReplayWindow);
      }
    }
    highest_ = seq;
    seen_.set(seq % kReplayWindow);
    return true;
  }
  if (highest_ - seq >= kReplayWindow) {
    return false;
  }
  const std::size_t slot = seq % kReplayWindow;
  if (seen_.test(slot)) {
    return false;
  }
  seen_.set(slot);
  return true;
}

}  // namespace tsap
