// Server-side replay judgement: a sliding window of kReplayWindow sequence numbers ending at the
// highest accepted one. Above the highest: accepted, the window moves. Inside: accepted once.
// Below: refused. Zero: never valid. Not thread-safe; the owner locks.
#pragma once

#include <bitset>
#include <cstdint>

#include "tarvexsap/tsap_wire.h"

namespace tsap {

class ReplayWindow {
 public:
  // Records seq and answers true if it had not been seen and is not below the window.
  bool accept(uint64_t seq);
  // highest is the highest seq accepted so far; 0 before any.
  uint64_t highest() const { return highest_; }

 private:
  uint64_t highest_ = 0;
  std::bitset<kReplayWindow> seen_;  // bit seq % kReplayWindow, for seqs inside the window
};

}  // namespace tsap
