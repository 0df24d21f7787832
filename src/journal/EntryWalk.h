// EntryWalk: finds the entries of a journal file, one after another.
//
// Two witnesses say where the entries are. The objects of a file lie in a row, so their sizes lead
// from one to the next: the walk. A chain of entry arrays lists the offsets of all entries: the
// list. Each alone can hide entries without a trace: a wrong size may lead to the beginning of a
// later object, and a wrong link or offset may lead to a later entry. So we follow both. The walk
// finds the entries, and the list must agree with it. Where they disagree, we say so and go on with
// the one that is right: an entry that really is where the list says, or the objects on the way.
// One wrong word therefore costs at most the entry that it is part of. The price is one look at
// the header of each object, some ten nanoseconds an entry.
//
// Where both fail, we try every eighth byte, because objects begin at multiples of eight. Random
// bytes often look like an object. So such a place counts only if the object there is followed by
// another object, by zeros up to the end, or by the end of what was written. If we asked for three
// objects in a row, we would find fewer entries behind damage. If we asked for one alone, we would
// find entries that never existed.
//
// The time is proportional to the size of the file, whatever it holds: the walk never goes back
// before an object that it accepted, and it looks for the zeros at the end only once.
//
// Threads: one at a time, except for the stop flag.

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>

#include "journal/DataMarks.h"
#include "journal/EntryStream.h"
#include "journal/JournalFile.h"
#include "journal/StoreReport.h"

namespace tessel {

// The offsets in a chain of entry arrays, as they stand there: a caller checks each of them.
class EntryChain {
 public:
  // Reads the main chain of `file`. Both must outlive the chain.
  EntryChain(JournalFile& file, const StopFlag& stop);

  // The next offset; 0 at the end of the chain, or soon after the stop flag was set. Asked for
  // every entry, so it is inlined, and what happens once in 512 entries is not.
  [[gnu::always_inline]] uint64_t next() {
    while (pieceNext_ == pieceSize_) [[unlikely]] if (!loadPiece()) return 0;
    const uint64_t offset = itemAt(pieceNext_++);
    return offset != 0 ? offset : endAtZero();
  }
  // Whether the chain ended before it had listed as many entries as the header counts. problemAt()
  // is then the offset of the damage.
  bool endedEarly() const { return endedEarly_; }
  uint64_t problemAt() const { return array_; }
  // The offset that the chain lists last; 0 if there is none. Uses up the chain.
  uint64_t last();

 private:
  [[gnu::noinline]] bool loadPiece();
  bool enterArray(uint64_t offset);
  [[gnu::noinline]] uint64_t endAtZero();
  bool end();
  uint64_t itemAt(size_t index) const {
    const uint8_t* item = piece_.get() + index * itemSize_;
    return itemSize_ == 4 ? journal_format::load<uint32_t>(item)
                          : journal_format::load<uint64_t>(item);
  }

  JournalFile& file_;
  const StopFlag& stop_;
  const size_t itemSize_;
  const size_t pieceBytes_;
  std::unique_ptr<uint8_t[]> piece_;  // null until the first piece is read
  size_t pieceSize_ = 0;              // in items
  size_t pieceNext_ = 0;
  uint64_t array_ = 0;       // offset of the array that is being read
  uint64_t nextArray_ = 0;   // offset of the array that it links to; 0: none
  uint64_t arraySize_ = 0;   // in items
  uint64_t arrayIndex_ = 0;  // items of the array that were read
  uint64_t listed_ = 0;      // items of the arrays before this one
  bool ended_ = false;
  bool endedEarly_ = false;
};

// Whether the first and the last entry that `file` lists have the times that its header gives them.
bool headerTellsTimes(JournalFile& file, const StopFlag& stop);

class EntryWalk {
 public:
  // Shows `marks` the data objects on its way and tells `report` of damage. All must outlive the
  // walk.
  EntryWalk(JournalFile& file, DataMarks& marks, FileReport& report, const StopFlag& stop);

  // Moves to the next entry. False at the end, or soon after the stop flag was set. The offsets of
  // the entries rise, so no entry comes twice.
  bool next();
  // Of the current entry. The sequence id is that of the file.
  const EntryHeader& header() const { return header_; }
  uint64_t offset() const { return entry_; }
  uint64_t size() const { return entrySize_; }  // bytes
  // Objects from here on were written for the current entry: the entry before ends here.
  uint64_t firstFresh() const { return firstFresh_; }
  uint64_t entriesFound() const { return found_; }

 private:
  // In place of an offset that the list gives: the list has ended; or its offset is wrong, and any
  // entry may be meant.
  static constexpr uint64_t kEnded = UINT64_MAX;
  static constexpr uint64_t kAny = UINT64_MAX - 1;

  bool atEnd() const;
  void passData();
  ObjectHeader objectAt(uint64_t offset);
  bool takeListed();
  [[gnu::noinline]] bool take(uint64_t offset);
  [[gnu::always_inline]] void accept(uint64_t offset, uint64_t size);
  [[gnu::noinline]] void compareWithList(uint64_t offset);
  [[gnu::noinline]] bool listIsRight(uint64_t object);
  void advanceList();
  [[gnu::noinline]] void checkListed();
  void tellOfList(uint64_t offset);
  bool passDamage();
  bool resynchronise(uint64_t offset);
  bool makesSense(uint64_t offset);
  bool objectBeginsAt(uint64_t offset);
  uint64_t onlyZerosFrom();
  std::optional<uint64_t> nextNonZero(uint64_t offset);
  std::optional<std::span<const uint8_t>> wordsAt(uint64_t offset);
  bool stopped() const { return stop_.load(std::memory_order_relaxed); }

  JournalFile& file_;
  DataMarks& marks_;
  FileReport& report_;
  const StopFlag& stop_;
  EntryChain chain_;
  uint64_t listed_ = kAny;    // where the list says that the next entry is
  bool listDiffers_ = false;  // the last entry was not where the list said
  uint64_t position_;         // the next object begins here
  uint64_t lastObject_ = 0;   // the last object that was accepted; 0: none
  std::optional<uint64_t> onlyZerosFrom_;
  uint64_t found_ = 0;
  uint64_t lastNumber_ = 0;  // sequence number of the current entry
  EntryHeader header_;
  uint64_t entry_ = 0;  // offset of the current entry
  uint64_t entrySize_ = 0;
  uint64_t entryEnd_;
  uint64_t firstFresh_;
};

}  // namespace tessel
