// What is remembered of data objects, so that each is read seldom more than once.
//
// TokenCache: which token a data object of a file has, and a part of its hash.
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
// together are the whole key: the number of the file and the offset divided by eight, because
// objects begin at multiples of eight.
//
// MarkPlaces: whether a data object was looked at, and whether it makes its entries worth reading.
// This is asked for every field of every entry, so it is two bits in a table that the processor
// keeps near.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <cstdint>
#include <memory>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel {

class TokenCache {
 private:
  static constexpr int kPlaceShift = 3;
  static constexpr int kPlaceBits = 32;  // of an offset, after the shift
  static constexpr int kFileBits = 13;
  static constexpr int kSetBits = 15;  // 2^15 sets of 24 bytes are 768 KiB
  static constexpr int kKeyBits = kPlaceBits + kFileBits;
  static constexpr int kTagBits = kKeyBits - kSetBits;  // 30, so that a tag fits 32 bits
  static constexpr size_t kSets = size_t{1} << kSetBits;

 public:
  struct Value {
    FieldToken token = kNoToken;
    uint32_t hash = 0;  // the lower half of the text's lookup3
  };

 private:
  struct Slot {
    uint32_t tag;
    Value value;
  };
  struct Set {
    Slot first;
    Slot second;
  };

 public:
  // Numbers of files are below this.
  static constexpr uint32_t kMaxFiles = uint32_t{1} << kFileBits;
  // The token that find() returns if nothing is remembered. No token has this value.
  static constexpr FieldToken kUnknown = UINT32_MAX;
  // Whether an object at `offset` can be remembered. Other offsets would have the key of another
  // object: those behind 32 GiB, before which the daemon rotates its files, and damaged ones.
  static constexpr bool takes(uint64_t offset) {
    constexpr uint64_t kMaxOffset = (uint64_t{1} << (kPlaceBits + kPlaceShift)) - 1;
    constexpr uint64_t kMisplaced = (uint64_t{1} << kPlaceShift) - 1;
    return (offset & (~kMaxOffset | kMisplaced)) == 0;
  }

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

    // What is remembered of the data object at `offset`. REQUIRES: takes(offset).
    Value find(uint64_t offset) const {
      const uint64_t key = keyOf(offset);
      Set& set = sets_[key >> kTagBits];
      if (set.first.tag == tagOf(key)) [[likely]]
        return set.first.value;
      if (set.second.tag != tagOf(key)) return {kUnknown, 0};
      std::swap(set.first, set.second);
      return set.first.value;
    }
    void store(uint64_t offset, Value value) {
      if (!takes(offset)) return;
      const uint64_t key = keyOf(offset);
      Set& set = sets_[key >> kTagBits];
      (set.first.tag == tagOf(key) ? set.first : set.second) = {tagOf(key), value};
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
  void clear() {
    const Slot empty{0, {kUnknown, 0}};
    std::fill_n(sets_.get(), kSets, Set{empty, empty});
  }

  uint32_t generation_ = 0;
  const std::unique_ptr<Set[]> sets_;
};

// The data objects of one file. Data objects are longer than 64 bytes, so each has a place of its
// own among the stretches of 64 bytes.
class MarkPlaces {
 public:
  enum State : uint8_t { unknown = 0, plain = 1, mark = 2 };

  // Bytes for the tables of all files of a store. They serve 2 GiB of files that are read at once;
  // most files follow one another.
  static constexpr size_t kTotal = size_t{8} << 20;

  // Takes its memory from `bytesLeft`, which must outlive it, and gives it back at its end.
  explicit MarkPlaces(size_t& bytesLeft) : bytesLeft_(bytesLeft) {}
  ~MarkPlaces() { bytesLeft_ += words_.size() * sizeof(uint64_t); }
  MarkPlaces(const MarkPlaces&) = delete;
  MarkPlaces& operator=(const MarkPlaces&) = delete;

  // The table as it is now, for a loop. Void after set().
  class View {
   public:
    explicit View(const MarkPlaces& places)
        : words_(places.words_.data()), size_(places.words_.size()), first_(places.first_) {}
    State at(uint64_t offset) const {
      const uint64_t word = (offset >> kWordShift) - first_;  // huge if it is below the table
      return word < size_ ? State(words_[word] >> shiftOf(offset) & 3) : unknown;
    }

   private:
    const uint64_t* words_;
    size_t size_;
    uint64_t first_;
  };

  // Remembers the state of an object that was unknown. False if there is no memory left for it.
  bool set(uint64_t offset, State state) {
    if (words_.empty()) first_ = offset >> kWordShift;
    const uint64_t word = (offset >> kWordShift) - first_;
    if (word >= words_.size() && !grow(word)) return false;
    words_[word] |= uint64_t{state} << shiftOf(offset);
    return true;
  }

 private:
  static constexpr int kWordShift = 11;  // a word holds 32 places of 64 bytes
  static int shiftOf(uint64_t offset) { return static_cast<int>(offset >> 5 & 62); }

  bool grow(uint64_t word) {
    const uint64_t size = std::max<uint64_t>(word + word / 2, 64);
    const uint64_t more = (size - words_.size()) * sizeof(uint64_t);
    if (word > kTotal || more > bytesLeft_) return false;
    bytesLeft_ -= static_cast<size_t>(more);
    words_.resize(static_cast<size_t>(size));
    return true;
  }

  size_t& bytesLeft_;
  uint64_t first_ = 0;  // the number of the first word: the objects begin behind large tables
  std::vector<uint64_t> words_;
};

}  // namespace tessel
