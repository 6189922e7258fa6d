// The device's set of issued, not yet answered request sequence numbers. Bounded: when full,
// the lowest (oldest) is dropped, so an unanswered request cannot pin memory for ever.
#pragma once

#include <cstdint>
#include <set>

#include "tarvexsap/tsap_wire.h"

namespace tsap {

class OutstandingSeqs {
 public:
  // OutstandingSeqs starts empty and holds at most `capacity` numbers.
  explicit OutstandingSeqs(std::size_t capacity = kMaxOutstanding) : capacity_(capacity) {}
  // add records `seq`, dropping the lowest numbers beyond the capacity.
  void add(uint64_t seq);
  // Removes seq and answers whether it was outstanding.
  bool take(uint64_t seq);
  bool contains(uint64_t seq) const { return seqs_.count(seq) != 0; }
  std::size_t size() const { return seqs_.size(); }
  void clear() { seqs_.clear(); }

 private:
  std::size_t capacity_;
  std::set<uint64_t> seqs_;
};

}  // namespace tsap
