#include "tarvexsap/tsap_outstanding.h"

namespace tsap {

void OutstandingSeqs::add(uint64_t seq) {
  seqs_.insert(seq);
  while (seqs_.size() > capacity_) {
    seqs_.erase(seqs_.begin());
  }
}

bool OutstandingSeqs::take(uint64_t seq) { return seqs_.erase(seq) != 0; }

}  // namespace tsap
