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
// Each line has five slots. What was stored or found last stands first; a new value pushes out the
// last.
//
// A slot must never return the token of another object: that would put a wrong value into an event.
// So a slot also holds the tag, the part of the key that does not select the line. Line and tag
// together are the whole key: the number of the file and the offset divided by eight, because
// objects begin at multiples of eight.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <cstdint>
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
  static constexpr int kPlaceShift = 3;
  static constexpr int kPlaceBits = 30;  // of an offset, after the shift
  static constexpr int kFileBits = 13;
  // The place of an object is its offset after the shift.
  static uint32_t placeOf(uint64_t offset) { return static_cast<uint32_t>(offset >> kPlaceShift); }

  static constexpr size_t kSlots = 5;
  struct Slot {
    uint32_t tag = 0;  // 0: empty
    Value value;
  };
  struct alignas(64) Line {
    Slot slots[kSlots];
  };

  // 2^kLineBits lines. A line serves 2^kStretchBits neighbouring places.
  template <int kLineBits, int kStretchBits>
  struct Table {
    static constexpr uint32_t kLines = uint32_t{1} << kLineBits;

    std::unique_ptr<Line[]> lines = std::make_unique<Line[]>(kLines);

    void clear() { std::fill_n(lines.get(), kLines, Line{}); }
  };

  template <int kLineBits, int kStretchBits>
  class View {
   public:
    View(const Table<kLineBits, kStretchBits>& table, uint32_t file)
        : lines_(table.lines.get()),
          // A tag has no room for the whole place. The bits of it that select the line are free,
          // and so are the two highest. They hold the number of the file, and a bit that no empty
          // slot has.
          file_((file & (kLines - 1)) << kStretchBits | (file >> kLineBits | kTaken) << kPlaceBits),
          // Without it the beginnings of all files would share the same lines. The factor is 2^32
          // divided by the golden ratio.
          firstLine_(file * 0x9e3779b9u) {}

    Slot* slotsOf(uint64_t offset) const {
      return lines_[((placeOf(offset) >> kStretchBits) + firstLine_) & (kLines - 1)].slots;
    }
    uint32_t tagOf(uint64_t offset) const {
      return (placeOf(offset) & ~((kLines - 1) << kStretchBits)) | file_;
    }
    // Null if nothing is remembered. What is found then stands first.
    const Value* find(uint64_t offset) const {
      Slot* const slots = slotsOf(offset);
      for (Slot* slot = slots; slot != slots + kSlots; ++slot) {
        if (slot->tag != tagOf(offset)) continue;
        std::rotate(slots, slot, slot + 1);
        return &slots->value;
      }
      return nullptr;
    }
    void store(uint64_t offset, Value value) const {
      Slot* const slots = slotsOf(offset);
      std::copy_backward(slots, slots + kSlots - 1, slots + kSlots);
      *slots = {tagOf(offset), value};
    }

   private:
    static constexpr uint32_t kLines = Table<kLineBits, kStretchBits>::kLines;
    static constexpr uint32_t kTaken = 2;
    static_assert(kFileBits <= kLineBits + 1 && kLineBits + kStretchBits <= kPlaceBits);

    Line* lines_;
    uint32_t file_;
    uint32_t firstLine_;
  };

  // 256 KiB, for 20,480 values. A stretch has 64 bytes, so only one object begins in it: the values
  // of one program stand beside one another and recur together, and one line could not hold them.
  static constexpr int kRecurringLineBits = 12;
  static constexpr int kRecurringStretchBits = 3;
  // 1 MiB, for 81,920 values: more than may be open at once. The shortest entry with a value of its
  // own takes some 200 bytes, so a stretch of 1 KiB has no more than five such values.
  static constexpr int kAwaitedLineBits = 14;
  static constexpr int kAwaitedStretchBits = 7;

 public:
  // Numbers of files are below this.
  static constexpr uint32_t kMaxFiles = uint32_t{1} << kFileBits;
  // Whether an object at `offset` can be remembered. Other offsets would have the key of another
  // object: those behind 8 GiB, before which the daemon rotates its files, and damaged ones.
  static constexpr bool takes(uint64_t offset) {
    constexpr uint64_t kMaxOffset = (uint64_t{1} << (kPlaceBits + kPlaceShift)) - 1;
    constexpr uint64_t kMisplaced = (uint64_t{1} << kPlaceShift) - 1;
    return (offset & (~kMaxOffset | kMisplaced)) == 0;
  }

  // Forgets all tokens if they are of another generation than `generation`.
  void useGeneration(uint32_t generation) {
    if (generation == generation_) [[likely]]
      return;
    generation_ = generation;
    recurring_.clear();
    awaited_.clear();
  }

  // The view of one file. Valid while the cache lives; cheap enough to make for every entry. All
  // calls REQUIRE that the cache takes the offset. What they return is valid until the next call.
  class OfFile {
   public:
    // REQUIRES: file < kMaxFiles.
    OfFile(const TokenCache& cache, uint32_t file)
        : recurring_(cache.recurring_, file), awaited_(cache.awaited_, file) {}

    // What is remembered of the data object at `offset`, if a single look finds it; or null. For
    // nearly every field of an entry that is enough.
    const Value* findAtOnce(uint64_t offset) const {
      const Slot& slot = *recurring_.slotsOf(offset);
      return slot.tag == recurring_.tagOf(offset) ? &slot.value : nullptr;
    }
    // What is remembered, or null.
    const Value* find(uint64_t offset) const {
      const Value* known = recurring_.find(offset);
      return known != nullptr ? known : awaited_.find(offset);
    }
    // Both REQUIRE that nothing is remembered.
    void storeRecurring(uint64_t offset, Value value) const { recurring_.store(offset, value); }
    // For a value that only one later entry has.
    void storeAwaited(uint64_t offset, Value value) const { awaited_.store(offset, value); }

   private:
    View<kRecurringLineBits, kRecurringStretchBits> recurring_;
    View<kAwaitedLineBits, kAwaitedStretchBits> awaited_;
  };

 private:
  uint32_t generation_ = 0;
  Table<kRecurringLineBits, kRecurringStretchBits> recurring_;
  Table<kAwaitedLineBits, kAwaitedStretchBits> awaited_;
};

}  // namespace tessel
