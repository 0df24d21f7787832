// The index of a journal file: which entries it has, and which of them have a certain field.
//
// EntryChain reads a chain of entry arrays. One chain lists all entries of a file. Each data object
// has a chain too, which lists the entries that refer to it. The offsets in a chain rise.
// EntryChain drops every piece that breaks this rule, and it ends at a broken link. It tells the
// caller where entries may be missing, and the caller searches there.
//
// MarkedEntries finds the entries that have a mark (see EntryMark). Few entries of a day have one,
// and reading the fields of all entries would be most of the work. MarkedEntries follows the lists
// of the few values that are marks. The reader reads only the header of every other entry.
//
// A wrong index would hide entries, and nobody would notice. So we use it only if
//   - the file is closed, because a writer links an entry in several steps;
//   - we find as many fields as the header counts;
//   - each value of a field links to an older value, which rules out circles;
//   - each companion has as many entries as the field that it accompanies.
// While we follow the lists, three more things must hold: a list is as long as its value says, its
// offsets rise, and the reader meets each listed entry. If one of them fails, the reader looks into
// every further entry. Even then a wrong offset in a list can hide the entry that it replaced. To
// find that entry, we would have to read the fields of every entry, which is what the index spares.
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
  // The most bytes of an array that are read at once. They hold 512 entries, so system calls are
  // rare, and they are few beside the window of the file.
  static constexpr size_t kLargestPiece = 4096;

  // Reads the chain that begins with the array at offset `first` and should list `count` entries.
  // `file` must outlive the chain.
  EntryChain(JournalFile& file, uint64_t first, uint64_t count,
             size_t largestPiece = kLargestPiece);

  // The offset of the next entry, greater than all before it; 0 at the end of the chain.
  uint64_t next() {
    gapBefore_ = false;
    if (pieceNext_ == pieceSize_) [[unlikely]]
      return firstOfNextPiece();
    return last_ = itemAt(pieceNext_++);
  }
  // Whether the chain is damaged just before the entry that next() returned last. Entries may be
  // missing there. problemAt() is the offset of the damage.
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
  uint64_t array_ = 0;       // offset of the array that is being read; 0: none is left
  uint64_t nextArray_ = 0;   // offset of the array that it links to
  uint64_t arraySize_ = 0;   // in items
  uint64_t arrayIndex_ = 0;  // items of the array that were read
  uint64_t listed_ = 0;      // items read in all arrays
  uint64_t last_ = 0;        // the entry that next() returned last
  bool gap_ = false;         // damage was found behind last_
  bool gapBefore_ = false;
  uint64_t problemAt_ = 0;
};

class MarkedEntries {
 public:
  // The most lists that all files of a store together may follow. Each list holds a piece of up to
  // 1 KiB, so all take up to 4 MiB. When none is left, the further files are read without their
  // index.
  static constexpr size_t kMaxListsOfStore = 4096;

  // Reads the index of `file`, which must outlive the result, and subtracts the lists that it uses
  // from `listsLeft`. Null if the reader must look into every entry: because `marks` is empty, the
  // file is being written, the index is damaged, it has too many fields or values, `listsLeft` is
  // too small, or `stop` was set.
  static std::unique_ptr<MarkedEntries> of(JournalFile& file, std::span<const EntryMark> marks,
                                           size_t& listsLeft, const StopFlag& stop);

  // Whether the reader must look into the entry at `offset`: it has a mark, or a list was just
  // found wrong. REQUIRES: the caller asks about every entry of the file, in order, until usable()
  // returns false.
  bool has(uint64_t offset) { return offset >= nearest_ && look(offset); }
  // False if the lists are damaged from here on. The caller must then look into every further
  // entry.
  bool usable() const { return usable_; }
  // Whether a list named an offset where no entry is. A marked entry may then have been hidden.
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
