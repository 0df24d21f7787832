// EntryChain: the offsets of entries as a chain of entry arrays of a journal file lists them: all
// entries of the file, or those that refer to one data object.
//
// The chain is read in pieces, small beside the windows of the files. A piece whose offsets are not
// all possible and strictly increasing is not used at all, and a broken link ends the chain: in
// both cases the caller is told that entries may lie in between, to look for them in line.
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <memory>

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

}  // namespace tessel
