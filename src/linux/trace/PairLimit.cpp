#include "linux/trace/PairLimit.h"

namespace tessel {

bool PairLimit::admits(StringRef subsystem, StringRef category) {
  const Pair pair{subsystem.hash(), category.hash()};
  if (pairs_.contains(pair)) return true;
  const size_t text = subsystem.textOr("").size() + category.textOr("").size();
  if (pairs_.size() >= limits_.pairs || textBytes_ + text > limits_.textBytes) {
    ++refusals_;
    return false;
  }
  pairs_.insert(pair);
  textBytes_ += text;
  return true;
}

}  // namespace tessel
