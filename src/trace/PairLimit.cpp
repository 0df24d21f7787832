#include "trace/PairLimit.h"

#include <bit>

namespace tessel {

PairLimit::PairLimit(PairLimits limits)
    : limits_(limits), slots_(std::bit_ceil(2 * limits.pairs + 2)) {}

PairLimit::Pair& PairLimit::slotOf(const Pair& pair) {
  const size_t mask = slots_.size() - 1;
  size_t at = (pair.subsystem + pair.category * 0x9e3779b97f4a7c15u) & mask;
  while (slots_[at] != Pair{} && slots_[at] != pair) at = (at + 1) & mask;
  return slots_[at];
}

bool PairLimit::admits(StringRef subsystem, StringRef category) {
  const Pair pair{subsystem.hash(), category.hash()};
  Pair& slot = slotOf(pair);
  if (slot == pair) return true;
  const size_t text = subsystem.textOr("").size() + category.textOr("").size();
  if (count_ >= limits_.pairs || textBytes_ + text > limits_.textBytes) {
    ++refusals_;
    return false;
  }
  slot = pair;
  ++count_;
  textBytes_ += text;
  return true;
}

}  // namespace tessel
