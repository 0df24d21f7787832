// EntryChain: the offsets of entries as a chain of entry arrays of a journal file lists them: all
// entries of the file, or those that refer to one data object.
//
// The chain is read in pieces, small beside the windows of the files. A piece whose offsets are not
// all possible and strictly increasing is not used at all, and a broken link ends the chain: in
// both cases the caller is told that entries may lie in between, to look for them in line.
//
// Threads: one at a time.
//
// MarkedEntries: which entries of a closed journal file carry a mark, as the file's own index says.
//
// A file keeps for each field the values that it has, and for each value the entries that refer to
// it. Most entries of a day carry no mark, and with the lists of those that do, nothing but the
// header of the others needs to be looked at. What the index says is held against itself wherever
// that is possible: all fields must be found that the file counts, every list must be as long as
// the value says, and each listed entry must be met. Where one of these fails, the index is given
// up and every entry is looked at. All that a wrong offset in a list can hide is the entry that it
// stood for.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <cstdint>
#include <memory>
#include <span>
#include <vector>

#include "journal/EntryStream.h"
#include "journal/JournalFile.h"

namespace tessel {

class EntryChain {
 public:
  static constexpr size_t kLargestPiece = 4096;  // bytes

  // The chain that begins with the array at `first` and lists `count` entries. `file` must outlive
  // the chain.
  EntryChain(JournalFile& file, uint64_t first, uint64_t count,
             size_t largestPiece = kLargestPiece);

  // The offset of the next entry, greater than all before; 0 where the chain ends.
  uint64_t next() {
    gapBefore_ = false;
    if (pieceNext_ == pieceSize_) [[unlikely]]
      return firstOfNextPiece();
    return last_ = itemAt(pieceNext_++);
  }
  // Whether entries that the chain does not list may come before what next() answered, and where
  // the chain is damaged there.
  bool gapBefore() const { return gapBefore_; }
  uint64_t problemAt() const { return problemAt_; }

 private:
  uint64_t firstOfNextPiece();
  bool loadPiece();
  bool enterArray(uint64_t offset);
  void finishArray();
  bool takePiece(size_t count);
  void damagedAt(uint64_t offset) {
    gap_ = true;
    problemAt_ = offset;
  }
  uint64_t itemAt(size_t index) const {
    const uint8_t* item = piece_.get() + index * itemSize_;
    return itemSize_ == 4 ? journal_format::load<uint32_t>(item)
                          : journal_format::load<uint64_t>(item);
  }

  JournalFile& file_;
  const size_t itemSize_;
  const uint64_t count_;
  const size_t pieceBytes_;
  std::unique_ptr<uint8_t[]> piece_;  // from when the first is read
  size_t pieceSize_ = 0;              // in items
  size_t pieceNext_ = 0;
  uint64_t array_ = 0;       // offset of the array that is read; 0: none is left
  uint64_t nextArray_ = 0;   // the one it links to
  uint64_t arraySize_ = 0;   // items it holds
  uint64_t arrayIndex_ = 0;  // items of it that were read
  uint64_t listed_ = 0;      // items read in all arrays
  uint64_t last_ = 0;        // greatest offset handed out
  bool gap_ = false;         // since what was last handed out
  bool gapBefore_ = false;   // before it
  uint64_t problemAt_ = 0;
};

class MarkedEntries {
 public:
  // Lists that the files of one store follow at once, to bound their memory.
  static constexpr size_t kMaxListsOfStore = 4096;

  // Reads the index of `file`, which must outlive the answer. Null where `marks` is empty, or where
  // the index does not tell: the file is still written, is damaged, has too many values, has
  // companions of a mark in entries without it; where the lists are more than `listsLeft`, from
  // which they are taken; or when `stop` is set.
  static std::unique_ptr<MarkedEntries> of(JournalFile& file, std::span<const EntryMark> marks,
                                           size_t& listsLeft, const StopFlag& stop);

  // Whether the entry at `offset` carries a mark. REQUIRES: every entry of the file is asked about,
  // in order, up to the first time that usable() answers false.
  bool has(uint64_t offset) { return offset >= nearest_ && look(offset); }
  // Whether the lists can be followed beyond the last marked entry.
  bool usable() const { return usable_; }
  // Whether that is because a place that they list held no entry: one may have been passed over.
  bool missed() const { return missed_; }
  // Whether an entry is listed that was not asked about yet.
  bool awaitsMore() const { return nearest_ != kNone; }

 private:
  static constexpr uint64_t kNone = UINT64_MAX;

  struct List {
    EntryChain rest;    // behind the first entry, which the value itself names
    uint64_t left = 0;  // of `rest`
    uint64_t next = 0;  // offset of the entry that comes next; kNone: there is none
    // The one behind it, so that an offset that is too large is found before it is waited for.
    uint64_t ahead = 0;
  };

  class IndexReader;

  bool look(uint64_t offset);
  static bool lookAhead(List& list);
  static bool advance(List& list);

  std::vector<List> lists_;
  uint64_t nearest_ = 0;  // the least `next`
  bool usable_ = true;
  bool missed_ = false;
};

}  // namespace tessel
