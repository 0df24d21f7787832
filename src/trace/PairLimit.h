// PairLimit: how many distinct (subsystem, category) pairs one run may deliver.
//
// What a run does per pair at its end takes time and memory, and a writer may make up as many pairs
// as it likes. A pair is known by its two seeded hashes, so that nothing is kept of its text.
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/Values.h"

namespace tessel {

struct PairLimits {
  size_t pairs = 4096;
  size_t textBytes = size_t{4} * 1024 * 1024;  // of all subsystems and categories together
};

class PairLimit {
 public:
  explicit PairLimit(PairLimits limits = {}) : limits_(limits) {}

  // Whether the pair is among those let in; lets it in where there is room. Counts a refusal.
  bool admits(StringRef subsystem, StringRef category);
  size_t pairs() const { return pairs_.size(); }
  uint64_t refusals() const { return refusals_; }

 private:
  struct Pair {
    uint64_t subsystem = 0;
    uint64_t category = 0;

    bool operator==(const Pair&) const = default;
  };

  const PairLimits limits_;
  std::vector<Pair> pairs_;  // those that were let in
  FlatIndex index_;          // of pairs_
  size_t textBytes_ = 0;
  uint64_t refusals_ = 0;
};

}  // namespace tessel
