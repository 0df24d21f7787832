// The index of a journal file: which entries it has, and which of them have a certain field.
//
// EntryChain reads a chain of entry arrays. One chain lists all entries of a file, and each data
// object has one that lists the entries which refer to it. Offsets in a chain rise. A piece of a
// chain that breaks this rule is not used at all, and a broken link ends the chain; the caller
// learns that entries may be missing before the next one, and searches there.
//
// MarkedEntries says which entries are worth looking into. Most entries of a day are not, and to
// read the fields of all would be most of the work. So it follows the lists of the few values that
// matter, and of all other entries the reader reads the header alone.
//
// The danger: a wrong index hides entries without a word. So the index is used only if
//   - the file is closed, because a writer links an entry in several steps;
//   - as many fields are found as the header counts;
//   - each value of a field is older than the one that links to it, which rules out circles;
//   - companions stand in as many entries as the field that they accompany.
// While it is followed, each list must be as long as its value says, must rise, and each listed
// entry must be met. If one of these fails, every further entry is looked into. A wrong offset in a
// list can then hide one entry, the one that it replaced. Looking up each entry in the lists of its
// values would find even that, but reads the fields that this saves.
//
// Threads: one at a time, except for the stop flag.

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
  // Bytes that are read at once, at most: 512 entries for one system call, and little beside the
  // window of the file.
  static constexpr size_t kLargestPiece = 4096;

  // The chain that begins with the array at offset `first` and should list `count` entries. `file`
  // must outlive the chain.
  EntryChain(JournalFile& file, uint64_t first, uint64_t count,
             size_t largestPiece = kLargestPiece);

  // The offset of the next entry, greater than all before it; 0 at the end of the chain.
  uint64_t next() {
    gapBefore_ = false;
    if (pieceNext_ == pieceSize_) [[unlikely]]
      return firstOfNextPiece();
    return last_ = itemAt(pieceNext_++);
  }
  // Whether the chain is damaged before the entry that next() returned, so that entries may be
  // missing there; and the offset of the damage.
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
  std::unique_ptr<uint8_t[]> piece_;  // null until the first piece is read
  size_t pieceSize_ = 0;              // in items
  size_t pieceNext_ = 0;
  uint64_t array_ = 0;       // offset of the array that is read; 0: none is left
  uint64_t nextArray_ = 0;   // offset of the array that it links to
  uint64_t arraySize_ = 0;   // in items
  uint64_t arrayIndex_ = 0;  // items of the array that were read
  uint64_t listed_ = 0;      // items read in all arrays
  uint64_t last_ = 0;        // what next() returned last
  bool gap_ = false;         // damage was met since then
  bool gapBefore_ = false;
  uint64_t problemAt_ = 0;
};

class MarkedEntries {
 public:
  // Lists that all files of a store together follow at once. Each holds a piece of up to 1 KiB, so
  // they take up to 4 MiB. Files that come later are read without their index.
  static constexpr size_t kMaxListsOfStore = 4096;

  // Reads the index of `file`, which must outlive the result, and takes its lists from `listsLeft`.
  // Null if every entry must be looked into: `marks` is empty, the index does not hold, there are
  // too many values or not enough lists left, or `stop` was set.
  static std::unique_ptr<MarkedEntries> of(JournalFile& file, std::span<const EntryMark> marks,
                                           size_t& listsLeft, const StopFlag& stop);

  // Whether the entry at `offset` has a mark. REQUIRES: the caller asks about every entry of the
  // file, in order, until usable() returns false.
  bool has(uint64_t offset) { return offset >= nearest_ && look(offset); }
  // False: the lists are damaged behind the last marked entry.
  bool usable() const { return usable_; }
  // Whether a list named an offset that is no entry. An entry may have been passed over there.
  bool missed() const { return missed_; }
  // Whether an entry is listed that the caller has not asked about yet.
  bool awaitsMore() const { return nearest_ != kNone; }

 private:
  static constexpr uint64_t kNone = UINT64_MAX;

  struct List {
    EntryChain rest;     // all entries but the first, whose offset stands in the data object
    uint64_t left = 0;   // entries of `rest` that are still to be read
    uint64_t next = 0;   // offset of the entry that comes next; kNone: there is none
    uint64_t ahead = 0;  // the one after it
  };

  class IndexReader;

  bool look(uint64_t offset);
  static bool lookAhead(List& list);
  static bool advance(List& list);

  std::vector<List> lists_;
  uint64_t nearest_ = 0;  // the smallest `next` of all lists
  bool usable_ = true;
  bool missed_ = false;
};

}  // namespace tessel
