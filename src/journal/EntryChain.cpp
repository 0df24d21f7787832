#include "journal/EntryChain.h"

#include <algorithm>
#include <utility>

namespace tessel {

using namespace journal_format;

namespace {
constexpr size_t kSmallestPiece = 256;  // bytes
}  // namespace

EntryChain::EntryChain(JournalFile& file, uint64_t first, uint64_t count, size_t largestPiece)
    : file_(file),
      itemSize_(file.header().compact() ? 4 : 8),
      count_(count),
      pieceBytes_(std::clamp(file.file().share() / 32, kSmallestPiece, largestPiece)) {
  if (!enterArray(first) && count_ != 0) damagedAt(first);
}

uint64_t EntryChain::firstOfNextPiece() {
  bool more = true;
  while (more && pieceNext_ == pieceSize_) more = loadPiece();
  gapBefore_ = std::exchange(gap_, false);
  return more ? last_ = itemAt(pieceNext_++) : 0;
}

// Makes the array at `offset` the one that is read.
bool EntryChain::enterArray(uint64_t offset) {
  const uint64_t previous = std::exchange(array_, 0);
  if (offset <= previous || !file_.mayHoldObject(offset, kArrayItemsAt)) return false;
  std::array<uint8_t, kArrayItemsAt> bytes;
  if (file_.file().read(offset, bytes) != bytes.size()) return false;
  const auto object = file_.objectHeader(bytes, file_.objectsEnd() - offset);
  if (!object || object->type != kEntryArray) return false;
  array_ = offset;
  nextArray_ = load<uint64_t>(bytes.data() + kArrayNextAt);
  arraySize_ = (object->size - kArrayItemsAt) / itemSize_;
  arrayIndex_ = 0;
  return true;
}

void EntryChain::finishArray() {
  const uint64_t next = nextArray_;
  const uint64_t last = array_;
  if (next == 0) {
    array_ = 0;
    if (listed_ < count_) damagedAt(last);
  } else if (!enterArray(next)) {
    damagedAt(last);
  }
}

// Reads the next piece, perhaps an empty one; false where the chain has ended.
bool EntryChain::loadPiece() {
  if (array_ == 0) return false;
  const bool growing = file_.header().beingWritten();
  if (growing && listed_ >= count_) {
    array_ = 0;
    return false;
  }
  if (arrayIndex_ == arraySize_) {
    finishArray();
    return array_ != 0;
  }
  uint64_t count = std::min<uint64_t>(arraySize_ - arrayIndex_, pieceBytes_ / itemSize_);
  // Items are linked in order, so what stands beyond the count was not linked when we looked.
  if (growing) count = std::min(count, count_ - listed_);
  if (!takePiece(static_cast<size_t>(count)))
    damagedAt(array_ + kArrayItemsAt + arrayIndex_ * itemSize_);
  arrayIndex_ += count;
  listed_ += count;
  return true;
}

// Reads `count` items. False where they are not usable; the piece is empty then.
bool EntryChain::takePiece(size_t count) {
  pieceSize_ = pieceNext_ = 0;
  const uint64_t from = array_ + kArrayItemsAt + arrayIndex_ * itemSize_;
  if (!piece_) piece_ = std::make_unique_for_overwrite<uint8_t[]>(pieceBytes_);
  if (file_.file().read(from, {piece_.get(), count * itemSize_}) != count * itemSize_) return false;
  uint64_t previous = last_;
  for (size_t i = 0; i < count; ++i) {
    const uint64_t offset = itemAt(i);
    if (offset <= previous || !file_.mayHoldObject(offset, kEntryItemsAt)) {
      // Behind the last entry an array is filled with zeros, or with what was linked meanwhile.
      if (listed_ + i < count_) return false;
      pieceSize_ = i;
      array_ = 0;
      return true;
    }
    previous = offset;
  }
  pieceSize_ = count;
  return true;
}

}  // namespace tessel
