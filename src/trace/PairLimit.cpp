#include "trace/PairLimit.h"

namespace tessel {

bool PairLimit::admits(StringRef subsystem, StringRef category) {
  const Pair pair{subsystem.hash(), category.hash()};
  const auto hash = static_cast<uint32_t>(pair.subsystem + pair.category * 0x9e3779b97f4a7c15u);
  const auto isPair = [&](uint32_t number) { return pairs_[number] == pair; };
  if (index_.find(hash, isPair) != FlatIndex::kNone) return true;
  const size_t text = subsystem.textOr("").size() + category.textOr("").size();
  if (pairs_.size() >= limits_.pairs || textBytes_ + text > limits_.textBytes) {
    ++refusals_;
    return false;
  }
  index_.add(hash, static_cast<uint32_t>(pairs_.size()));
  pairs_.push_back(pair);
  textBytes_ += text;
  return true;
}

}  // namespace tessel
