// TokenCache: which token a data object of which file has, remembered in a fixed amount of memory.
//
// One cache serves all files of a store, so its size depends neither on their number nor on theirs.
// A place has a set of two slots: what is new comes into the second and takes the first when it is
// met again, so that the many values that occur once or twice do not push out those that recur. No
// two data objects begin within the same 64 bytes, so that is how exactly places are told apart.
// What falls out is asked for again.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <cstdint>
#include <memory>
#include <utility>

#include "journal/EntryStream.h"

namespace tessel {

class TokenCache {
 private:
  static constexpr int kPlaceShift = 6;
  static constexpr int kPlaceBits = 32;  // of a place in a file
  static constexpr int kFileBits = 13;
  static constexpr int kSetBits = 15;
  static constexpr int kKeyBits = kPlaceBits + kFileBits;
  static constexpr int kTagBits = kKeyBits - kSetBits;
  static constexpr size_t kSets = size_t{1} << kSetBits;
  struct Slot {
    uint32_t tag;
    FieldToken token;
  };
  struct Set {
    Slot first;
    Slot second;
  };

 public:
  // Files whose tokens can be remembered; the number of one is below it.
  static constexpr uint32_t kMaxFiles = uint32_t{1} << kFileBits;
  // No journal is as large as that; greater offsets would be taken for others.
  static constexpr uint64_t kMaxOffset = (uint64_t{1} << (kPlaceBits + kPlaceShift)) - 1;
  // Answered where nothing is remembered. No token has this value.
  static constexpr FieldToken kUnknown = UINT32_MAX;

  TokenCache() : sets_(std::make_unique_for_overwrite<Set[]>(kSets)) { clear(); }

  // Forgets everything where what it remembers is of another generation of tokens.
  void useGeneration(uint32_t generation) {
    if (generation == generation_) [[likely]]
      return;
    generation_ = generation;
    clear();
  }

  // What is remembered of one file. Valid while the cache lives, and small enough to be made for
  // every entry.
  class OfFile {
   public:
    // REQUIRES: file < kMaxFiles.
    OfFile(TokenCache& cache, uint32_t file)
        : sets_(cache.sets_.get()), file_(uint64_t{file} << kPlaceBits) {}

    // The token of the data object at `offset`, at most kMaxOffset; kUnknown where it is not
    // remembered.
    FieldToken find(uint64_t offset) const {
      const uint64_t key = keyOf(offset);
      Set& set = sets_[key >> kTagBits];
      if (set.first.tag == tagOf(key)) [[likely]]
        return set.first.token;
      if (set.second.tag != tagOf(key)) return kUnknown;
      std::swap(set.first, set.second);
      return set.first.token;
    }
    void store(uint64_t offset, FieldToken token) {
      if (offset > kMaxOffset) return;
      const uint64_t key = keyOf(offset);
      Set& set = sets_[key >> kTagBits];
      (set.first.tag == tagOf(key) ? set.first : set.second) = {tagOf(key), token};
    }

   private:
    // An odd factor maps the places one to one, so slot and tag together are the place.
    uint64_t keyOf(uint64_t offset) const {
      constexpr uint64_t kKeys = (uint64_t{1} << kKeyBits) - 1;
      return (file_ | offset >> kPlaceShift) * 0x9e3779b97f4a7c15u & kKeys;
    }
    static uint32_t tagOf(uint64_t key) {
      return static_cast<uint32_t>(key & ((uint64_t{1} << kTagBits) - 1));
    }

    Set* sets_;
    uint64_t file_;
  };

 private:
  // An empty slot answers for whatever place has its tag.
  void clear() { std::fill_n(sets_.get(), kSets, Set{{0, kUnknown}, {0, kUnknown}}); }

  uint32_t generation_ = 0;
  const std::unique_ptr<Set[]> sets_;
};

}  // namespace tessel
