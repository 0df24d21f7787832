// TokenCache: remembers which token a data object of a file has, in half a megabyte.
//
// Without it each field of each entry would cost a read and a lookup. One cache serves all files of
// a store, so its size does not depend on the files. It fits the processor's second-level cache; a
// table of all data objects would not fit and would have no bound. If the cache has forgotten a
// token, the reader reads the data object and shows it to the tokenizer again.
//
// A key is made of the number of the file and the offset of the object. It selects a set of two
// slots. A new token goes to the second slot; when it is found there, it moves to the first. Most
// values of a journal occur once. They push out one another in the second slot, but not the values
// that recur.
//
// A slot must never return the token of another object: that would put a wrong value into an event.
// So a slot also holds the tag, the part of the key that does not select the set. Set and tag
// together are the whole key. The key holds the offset divided by 64. Data objects are longer than
// 64 bytes and do not overlap, so no two of a file have the same key.
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
  static constexpr int kPlaceShift = 6;  // the header of a data object alone has 64 bytes
  static constexpr int kPlaceBits = 32;  // of an offset, after the shift
  static constexpr int kFileBits = 13;
  static constexpr int kSetBits = 15;  // 2^15 sets of 16 bytes are 512 KiB
  static constexpr int kKeyBits = kPlaceBits + kFileBits;
  static constexpr int kTagBits = kKeyBits - kSetBits;  // 30, so that a tag fits 32 bits
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
  // Numbers of files are below this.
  static constexpr uint32_t kMaxFiles = uint32_t{1} << kFileBits;
  // 256 GiB of a file. An object behind that would have the key of another one, so the cache never
  // remembers it. The daemon rotates its files long before.
  static constexpr uint64_t kMaxOffset = (uint64_t{1} << (kPlaceBits + kPlaceShift)) - 1;
  // What find() returns if nothing is remembered. No token has this value.
  static constexpr FieldToken kUnknown = UINT32_MAX;

  TokenCache() : sets_(std::make_unique_for_overwrite<Set[]>(kSets)) { clear(); }

  // Forgets all tokens if they are of another generation than `generation`.
  void useGeneration(uint32_t generation) {
    if (generation == generation_) [[likely]]
      return;
    generation_ = generation;
    clear();
  }

  // The view of one file. Valid while the cache lives; cheap enough to make for every entry.
  class OfFile {
   public:
    // REQUIRES: file < kMaxFiles.
    OfFile(TokenCache& cache, uint32_t file)
        : sets_(cache.sets_.get()), file_(uint64_t{file} << kPlaceBits) {}

    // The token of the data object at `offset`, or kUnknown. REQUIRES: offset <= kMaxOffset.
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
    // Multiplying by an odd number modulo a power of two loses nothing, and spreads neighbouring
    // objects over the sets. The number is 2^64 divided by the golden ratio.
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
  // An empty slot has a tag too, 0, so it answers kUnknown for the key that has this tag.
  void clear() { std::fill_n(sets_.get(), kSets, Set{{0, kUnknown}, {0, kUnknown}}); }

  uint32_t generation_ = 0;
  const std::unique_ptr<Set[]> sets_;
};

}  // namespace tessel
