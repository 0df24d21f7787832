// FlatIndex: a hash index over items that its user keeps. With it, the seeded hash of small words.
//
// The user keeps its items in a vector or the like and numbers them. The index keeps a 32-bit hash
// and that number for each item. In a search it asks the user whether the item of a number is the
// one that is wanted. So one index serves keys of any kind, and growing it touches no key. A key is
// compared only where all 32 bits of the hash agree.
//
// The slots are one array. A search begins at the hash's own slot and goes on from there (open
// addressing with linear probing). At most half of the slots are taken. Most searches here are for
// items that are not in the index, and at half load such a search looks at 2.5 slots on average,
// which usually lie in one cache line. At seven eighths it would look at 32. A slot takes 8 bytes,
// so an item costs 16 to 32 bytes.
//
// Chained buckets were discarded, because every link is a cache miss. Robin-hood probing was
// discarded, because at half load it only adds moves.
//
// Hashes must be seeded (hashWords(), hashText()). A writer who could choose keys with equal hashes
// would make every search as long as the table; the answers would still be right.
//
// Threads: only one while it changes. Any number of threads may search it between changes.

#pragma once

#include <algorithm>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <random>
#include <utility>
#include <vector>

namespace tessel {

// Random numbers of this process, which a writer of trace points cannot know.
struct HashSeeds {
  uint64_t first;
  uint64_t second;
};

inline const HashSeeds& hashSeeds() {
  static const HashSeeds seeds = [] {
    std::random_device device;
    const auto word = [&] { return (uint64_t{device()} << 32) ^ device(); };
    return HashSeeds{word(), word()};
  }();
  return seeds;
}

// Folds the 128-bit product into one word, so that every bit of both factors counts.
inline uint64_t mixWords(uint64_t a, uint64_t b) {
  __extension__ using Wide = unsigned __int128;
  const Wide product = Wide{a} * b;
  return static_cast<uint64_t>(product) ^ static_cast<uint64_t>(product >> 64);
}

// Seeded 32-bit hash of the words in their order.
template <typename... Words>
uint32_t hashWords(Words... words) {
  const auto& [first, second] = hashSeeds();
  uint64_t state = first;
  ((state = mixWords(state ^ words, second)), ...);
  return static_cast<uint32_t>(state ^ state >> 32);
}

class FlatIndex {
 public:
  // Stands for "no number"; no item may have it.
  static constexpr uint32_t kNone = UINT32_MAX;

  // Has room for `expected` items before it grows for the first time.
  explicit FlatIndex(size_t expected = 8)
      : slots_(std::bit_ceil(std::max<size_t>(2 * expected, 2))) {}

  // The number under `hash` for which `isIt(number)` holds; kNone where there is none.
  template <typename IsIt>
  uint32_t find(uint32_t hash, const IsIt& isIt) const {
    return slots_[slotOf(hash, isIt)].number;
  }
  // The same. If there is none, enters the number that `add()` answers under `hash`. `add` may
  // change the user's items but not this index. A search that finds its number allocates nothing.
  template <typename IsIt, typename Add>
  uint32_t findOrAdd(uint32_t hash, const IsIt& isIt, const Add& add) {
    const size_t at = slotOf(hash, isIt);
    if (slots_[at].number != kNone) return slots_[at].number;
    return put(at, {hash, add()});
  }
  // REQUIRES: the item of `number` is not in the index.
  void add(uint32_t hash, uint32_t number) { put(slotOf(hash, isNone), {hash, number}); }
  // REQUIRES: `number` is in the index, under `hash`.
  void erase(uint32_t hash, uint32_t number) {
    close(slotOf(hash, [number](uint32_t other) { return other == number; }));
    --size_;
  }
  // Takes out all numbers and keeps the memory.
  void clear() {
    std::fill(slots_.begin(), slots_.end(), Slot{});
    size_ = 0;
  }

  size_t size() const { return size_; }
  // Bytes.
  size_t memoryUsed() const { return slots_.capacity() * sizeof(Slot); }

 private:
  struct Slot {
    uint32_t hash = 0;
    uint32_t number = kNone;  // kNone: the slot is free
  };

  static bool isNone(uint32_t) { return false; }
  // The slot of the number that is wanted, or else the free slot where it would stand.
  template <typename IsIt>
  size_t slotOf(uint32_t hash, const IsIt& isIt) const {
    const size_t mask = slots_.size() - 1;
    size_t at = hash & mask;
    for (;; at = (at + 1) & mask) {
      const Slot& slot = slots_[at];
      if (slot.number == kNone || (slot.hash == hash && isIt(slot.number))) return at;
    }
  }
  uint32_t put(size_t at, Slot slot) {
    slots_[at] = slot;
    if (++size_ * 2 > slots_.size()) grow();
    return slot.number;
  }
  // Frees the slot at `hole`. A search ends at a free slot, so a hole must not stand between a
  // number and the slot that its hash names. Each number that was pushed beyond the hole moves back
  // into it and leaves a new hole. A number stays if its hash names a slot behind the hole.
  void close(size_t hole) {
    const size_t mask = slots_.size() - 1;
    for (size_t at = (hole + 1) & mask; slots_[at].number != kNone; at = (at + 1) & mask) {
      const size_t pushed = (at - slots_[at].hash) & mask;
      if (pushed < ((at - hole) & mask)) continue;
      slots_[hole] = slots_[at];
      hole = at;
    }
    slots_[hole] = {};
  }
  void grow() {
    std::vector<Slot> old(slots_.size() * 2);
    old.swap(slots_);
    for (const Slot& slot : old) {
      if (slot.number != kNone) slots_[slotOf(slot.hash, isNone)] = slot;
    }
  }

  std::vector<Slot> slots_;  // their number is a power of two, so a mask replaces a division
  size_t size_ = 0;
};

}  // namespace tessel
