// TokenCache remembers which token a data object of a file has, and a part of its hash, so that
// each object is read seldom more than once.
//
// Without it each field of each entry would cost a read and a lookup. One cache serves all files of
// a store, so its size does not depend on the files. A table of all data objects would have no
// bound. If the cache has forgotten a token, the reader reads the data object and shows it to the
// tokenizer again. If the object lies far back, that costs a system call: as much as ten entries.
//
// There are two tables, because two kinds of values are remembered for different reasons. A value
// that recurs is asked for in nearly every entry. All such values of a day fit into a small table,
// and the processor keeps that table near. A value that only one later entry has is mostly the id
// of an interval. It is asked for once, and up to 65,536 other ids may come before. In one table
// the ids would push out the values that recur, and every id would cost a look into main memory.
//
// Both tables are made of lines, as long as a line of the processor's cache. A stretch of the file
// selects a line, and so neighbours in the file have neighbouring lines. A hash would spread them,
// but ids are stored in the order of the file and asked for in nearly the same order. The line of
// an id has several ids that come soon after it, so they share one look into main memory.
// In both a new value stands first in its line and pushes out the last. A recurring value that is
// found moves to the front. A value that was awaited has been found then, so it moves to the end:
// if it stayed, values that are still awaited would be pushed out in its place, one in seventy.
//
// A slot must never return the token of another object: that would put a wrong value into an event.
// So a slot also holds the key, or the part of it that does not select the line. The key is the
// number of the file and the offset. A recurring value is looked up for nearly every field, so its
// slot has the whole key: one addition makes it, and its own bits select the line. A slot of the
// other table has a tag of 32 bits, so that a line has five slots and not four. Four would be too
// few: one id in a hundred would be read again.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <memory>

#include "journal/EntryStream.h"

namespace tessel {

class TokenCache {
 public:
  struct Value {
    FieldToken token = kNoToken;
    uint32_t hash = 0;  // the lower half of the text's lookup3
  };

 private:
  static constexpr int kFileBits = 13;
  static constexpr int kOffsetBits = 33;

  template <typename Slot, size_t kSlots>
  static void pushInto(Slot (&line)[kSlots], const Slot& slot) {
    std::copy_backward(line, line + kSlots - 1, line + kSlots);
    line[0] = slot;
  }

  // 256 KiB, for 16,384 values. A stretch has 64 bytes, as a line has, so only one object begins in
  // it: the values of one program stand beside one another and recur together, and one line could
  // not hold them.
  class Recurring {
   public:
    struct Slot {
      uint64_t key = 0;  // 0: empty
      Value value;
    };
    struct alignas(64) Line {
      Slot slots[4];
    };

    // Added to an offset, it makes the key. Without the lower half the beginnings of all files
    // would share the same lines. It is below 2^32, so offsets and it stay below the number of the
    // file. The factor is 2^32 divided by the golden ratio.
    static uint64_t baseOf(uint32_t file) {
      return uint64_t{file + 1} << (kOffsetBits + 1) | (file * 0x9e3779b9u & ~uint32_t{63});
    }
    Line* lines() const { return lines_.get(); }
    static Slot (&lineOf(Line* lines, uint64_t key))[4] {
      return lines[key / sizeof(Line) % kLines].slots;
    }
    void clear() { std::fill_n(lines_.get(), kLines, Line{}); }

   private:
    static constexpr size_t kLines = size_t{1} << 12;
    static_assert(sizeof(Line) == 64);
    std::unique_ptr<Line[]> lines_ = std::make_unique<Line[]>(kLines);
  };

  // 1 MiB, for 81,920 values: more than may be open at once. The shortest entry with a value of its
  // own takes some 200 bytes, so a stretch of 1 KiB has no more than five such values.
  class Awaited {
   public:
    struct Slot {
      uint32_t tag = 0;  // 0: empty
      Value value;
    };
    struct alignas(64) Line {
      Slot slots[5];
    };

    Slot (&lineOf(uint32_t file, uint64_t offset) const)[5] {
      return lines_[((placeOf(offset) >> kStretchBits) + file * 0x9e3779b9u) % kLines].slots;
    }
    // A tag has no room for the whole place. The bits of it that select the line are free, and so
    // are the two highest. They hold the number of the file, and a bit that no empty slot has.
    static uint32_t tagOf(uint32_t file, uint64_t offset) {
      constexpr uint32_t kTaken = 2;
      return (placeOf(offset) & ~((kLines - 1) << kStretchBits)) |
             (file & (kLines - 1)) << kStretchBits | (file >> kLineBits | kTaken) << kPlaceBits;
    }
    void clear() { std::fill_n(lines_.get(), kLines, Line{}); }

   private:
    static constexpr int kLineBits = 14;
    static constexpr uint32_t kLines = uint32_t{1} << kLineBits;
    static constexpr int kStretchBits = 7;  // 128 places
    // The place of an object is its offset divided by eight: objects begin at multiples of eight.
    static constexpr int kPlaceBits = kOffsetBits - 3;
    static uint32_t placeOf(uint64_t offset) { return static_cast<uint32_t>(offset >> 3); }
    static_assert(kFileBits <= kLineBits + 1 && kLineBits + kStretchBits <= kPlaceBits);

    std::unique_ptr<Line[]> lines_ = std::make_unique<Line[]>(kLines);
  };

 public:
  // Numbers of files are below this.
  static constexpr uint32_t kMaxFiles = uint32_t{1} << kFileBits;
  // Whether an object at `offset` can be remembered. Other offsets would have the key of another
  // object: those behind 8 GiB, before which the daemon rotates its files, and damaged ones.
  static constexpr bool takes(uint64_t offset) {
    return offset < uint64_t{1} << kOffsetBits && offset % 8 == 0;
  }

  // Forgets all tokens if they are of another generation than `generation`.
  void useGeneration(uint32_t generation) {
    if (generation != generation_) [[unlikely]]
      forgetAll(generation);
  }

  // The view of one file. Valid while the cache lives; cheap enough to make for every entry. Except
  // for findAtOnce(), all calls REQUIRE that the cache takes the offset. What they return is valid
  // until the next call.
  class OfFile {
   public:
    // REQUIRES: file < kMaxFiles.
    OfFile(const TokenCache& cache, uint32_t file)
        : cache_(cache),
          lines_(cache.recurring_.lines()),
          base_(Recurring::baseOf(file)),
          file_(file) {}

    // What is remembered of the data object at `offset`, if a single look finds it; or null. For
    // nearly every field of an entry that is enough. `Offset` has as many bits as the offsets of
    // the file: one of 32 bits need not be compared with the bound.
    template <typename Offset>
    const Value* findAtOnce(Offset offset) const {
      const uint64_t key = base_ + offset;
      const Recurring::Slot& slot = Recurring::lineOf(lines_, key)[0];
      return slot.key == key && uint64_t{offset} >> kOffsetBits == 0 ? &slot.value : nullptr;
    }
    // What is remembered, or null.
    const Value* find(uint64_t offset) const {
      auto& recurring = Recurring::lineOf(lines_, base_ + offset);
      for (Recurring::Slot& slot : recurring) {
        if (slot.key != base_ + offset) continue;
        std::rotate(recurring, &slot, &slot + 1);
        return &recurring[0].value;
      }
      auto& awaited = cache_.awaited_.lineOf(file_, offset);
      const uint32_t tag = Awaited::tagOf(file_, offset);
      for (Awaited::Slot& slot : awaited) {
        if (slot.tag != tag) continue;
        std::rotate(&slot, &slot + 1, std::end(awaited));
        return &std::rbegin(awaited)->value;
      }
      return nullptr;
    }
    // Both REQUIRE that nothing is remembered.
    void storeRecurring(uint64_t offset, Value value) const {
      pushInto(Recurring::lineOf(lines_, base_ + offset), {base_ + offset, value});
    }
    // For a value that only one later entry has.
    void storeAwaited(uint64_t offset, Value value) const {
      pushInto(cache_.awaited_.lineOf(file_, offset), {Awaited::tagOf(file_, offset), value});
    }

   private:
    const TokenCache& cache_;
    Recurring::Line* lines_;
    uint64_t base_;
    uint32_t file_;
  };

 private:
  // Not inlined: the empty lines that it copies would widen the stack of each entry.
  [[gnu::noinline]] void forgetAll(uint32_t generation) {
    generation_ = generation;
    recurring_.clear();
    awaited_.clear();
  }

  uint32_t generation_ = 0;
  Recurring recurring_;
  Awaited awaited_;
};

}  // namespace tessel
