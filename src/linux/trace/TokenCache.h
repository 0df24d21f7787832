// TokenCache: which token a data object of which file has, remembered in a fixed amount of memory.
//
// One cache serves all files of a store, so its size depends neither on their number nor on theirs.
// What falls out is asked for again; what is used often stays, as a pair of slots drops the one
// that was stored first.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <utility>
#include <vector>

#include "linux/trace/EntryStream.h"

namespace tessel {

class TokenCache {
 public:
  // Names a data object: the number of its file and its offset, a multiple of eight, never 0.
  static uint64_t keyFor(uint32_t file, uint64_t offset) {
    return uint64_t{file} << 50 | offset >> 3;
  }

  TokenCache() : pairs_(kPairs) {}

  // Drops everything when the generation of the tokens is another than before.
  std::optional<FieldToken> find(uint64_t key, uint32_t generation) {
    Pair& pair = pairs_[indexOf(key)];
    if (pair[0].key == key && pair[0].generation == generation) return pair[0].token;
    if (pair[1].key != key || pair[1].generation != generation) return std::nullopt;
    return pair[1].token;
  }
  // REQUIRES: find(key, generation) finds nothing.
  void store(uint64_t key, FieldToken token, uint32_t generation) {
    Pair& pair = pairs_[indexOf(key)];
    pair[1] = std::exchange(pair[0], Slot{key, token, generation});
  }

 private:
  static constexpr int kPairBits = 17;
  static constexpr size_t kPairs = size_t{1} << kPairBits;

  struct Slot {
    uint64_t key = 0;
    FieldToken token = kNoToken;
    uint32_t generation = 0;
  };
  using Pair = std::array<Slot, 2>;

  static size_t indexOf(uint64_t key) {
    return static_cast<size_t>(key * 0x9e3779b97f4a7c15u >> (64 - kPairBits));
  }

  std::vector<Pair> pairs_;
};

}  // namespace tessel
