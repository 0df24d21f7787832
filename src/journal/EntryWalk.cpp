// The list, the walk, their disagreements, and the search where both fail.

#include "journal/EntryWalk.h"

#include <algorithm>
#include <array>
#include <utility>

#include "platform/Invariant.h"

namespace tessel {

using namespace journal_format;

namespace {
// The most bytes of an array that are read at once. They hold 512 entries, so system calls are
// rare, and they are few beside the window of the file.
constexpr size_t kLargestPiece = 4096;
// If a store has thousands of files, their windows are small and so are the pieces of their chains.
// A piece of 32 entries still keeps system calls rare.
constexpr size_t kSmallestPiece = 256;
}  // namespace

EntryChain::EntryChain(JournalFile& file, const StopFlag& stop)
    : file_(file),
      stop_(stop),
      itemSize_(file.header().compact() ? 4 : 8),
      pieceBytes_(std::clamp(file.file().share() / 32, kSmallestPiece, kLargestPiece)),
      nextArray_(file.header().entryArray) {}

// Begins to read the array at `offset`. The daemon only appends arrays, so in an intact file each
// link leads forward. We refuse a link that leads back, and so no circle of links can hold us.
bool EntryChain::enterArray(uint64_t offset) {
  if (offset <= array_ || !file_.mayHoldObject(offset, kArrayItemsAt)) return false;
  std::array<uint8_t, kArrayItemsAt> bytes;
  if (file_.file().read(offset, bytes) != bytes.size()) return false;
  const ObjectHeader object = JournalFile::objectHeader(bytes.data(), file_.objectsEnd() - offset);
  if (object.size == 0 || object.type != kEntryArray) return false;
  listed_ += arraySize_;
  array_ = offset;
  nextArray_ = load<uint64_t>(bytes.data() + kArrayNextAt);
  arraySize_ = (object.size - kArrayItemsAt) / itemSize_;
  arrayIndex_ = 0;
  return true;
}

// Reads the next piece; false at the end of the chain.
bool EntryChain::loadPiece() {
  if (ended_ || stop_.load(std::memory_order_relaxed)) return false;
  if (arrayIndex_ == arraySize_ && (nextArray_ == 0 || !enterArray(nextArray_))) return end();
  if (!piece_) piece_ = std::make_unique_for_overwrite<uint8_t[]>(pieceBytes_);
  const size_t count =
      static_cast<size_t>(std::min<uint64_t>(arraySize_ - arrayIndex_, pieceBytes_ / itemSize_));
  const uint64_t from = array_ + kArrayItemsAt + arrayIndex_ * itemSize_;
  pieceNext_ = pieceSize_ = 0;
  if (file_.file().read(from, {piece_.get(), count * itemSize_}) != count * itemSize_) return end();
  pieceSize_ = count;
  arrayIndex_ += count;
  // The daemon lists an entry when it is finished. Entries beyond the header's count were added
  // since, and the window may hold what stood in their place before.
  if (listed_ + arrayIndex_ > file_.header().entryCount && file_.beingWritten())
    file_.file().forget();
  return true;
}

// An array is allocated longer than it is filled, so a zero ends the chain.
uint64_t EntryChain::endAtZero() {
  arrayIndex_ -= pieceSize_ - (pieceNext_ - 1);
  pieceNext_ = pieceSize_ = 0;
  end();
  return 0;
}

// The end of a chain and an offset or link that was overwritten look alike. The count tells them
// apart.
bool EntryChain::end() {
  ended_ = true;
  endedEarly_ = listed_ + arrayIndex_ < file_.header().entryCount;
  return false;
}

uint64_t EntryChain::last() {
  uint64_t left = file_.header().entryCount;
  if (left == 0) return 0;
  for (; !stop_.load(std::memory_order_relaxed) && enterArray(nextArray_); left -= arraySize_) {
    if (left > arraySize_ && nextArray_ != 0) continue;
    arrayIndex_ = std::min(left, arraySize_) - 1;
    return next();
  }
  return 0;
}

bool headerTellsTimes(JournalFile& file, const StopFlag& stop) {
  EntryHeader entry;
  const uint64_t first = EntryChain(file, stop).next();
  if (file.readEntry(first, first, entry) == 0 || entry.realtime != file.header().headRealtime)
    return false;
  const uint64_t last = EntryChain(file, stop).last();
  return file.readEntry(last, last, entry) != 0 && entry.realtime == file.header().tailRealtime;
}

EntryWalk::EntryWalk(JournalFile& file, DataMarks& marks, FileReport& report, const StopFlag& stop)
    : file_(file),
      marks_(marks),
      report_(report),
      stop_(stop),
      chain_(file, stop),
      position_(file.header().headerSize),
      entryEnd_(position_),
      firstFresh_(position_) {
  header_.sequenceId = file.header().sequenceId;
  advanceList();
}

// The object at `offset`; its size is 0 if no object may stand there.
inline ObjectHeader EntryWalk::objectAt(uint64_t offset) {
  if (!file_.mayHoldObject(offset, kObjectHeaderSize)) return {};
  // Computed before at(): reading may find that the file was cut before `offset`. objectsEnd() then
  // moves, and this difference would be negative.
  const uint64_t room = file_.objectsEnd() - offset;
  const uint8_t* at = file_.file().at(offset, kObjectHeaderSize, entryEnd_);
  if (at == nullptr) return {};
  return JournalFile::objectHeader(at, room);
}

// Passes the data objects that stand in the window before the entry that the list names. They are
// two thirds of all objects, and next() would take three times as long for each. Whatever is
// unusual in any way is left to next().
void EntryWalk::passData() {
  if (listed_ > file_.objectsEnd() || listed_ < position_) return;
  const std::span<const uint8_t> bytes = file_.file().restOfWindow(position_);
  const size_t headerSize = file_.dataHeaderSize();
  const uint64_t room = listed_ - position_;
  uint64_t last = 0;
  uint64_t passed = 0;
  while (passed + headerSize + kMaxMark <= bytes.size()) {
    const uint8_t* at = bytes.data() + passed;
    const uint64_t size = file_.plainDataSize(at, room - passed);
    if (size == 0) break;
    marks_.see(position_ + passed, {reinterpret_cast<const char*>(at + headerSize),
                                    std::min<size_t>(size - headerSize, kMaxMark)});
    last = passed;
    passed += alignUp(size);
  }
  if (passed == 0) return;
  lastObject_ = position_ + last;
  position_ += passed;
  TESSEL_INVARIANT(position_ <= listed_);  // both are multiples of eight
}

bool EntryWalk::next() {
  while (!stopped() && !atEnd()) {
    if (position_ != listed_) passData();
    const uint64_t offset = position_;
    if (offset == listed_ && takeListed()) [[likely]]
      return true;
    const ObjectHeader object = objectAt(offset);
    if (object.size == 0) [[unlikely]] {
      if (!passDamage()) return false;
      continue;
    }
    const uint64_t end = alignUp(offset + object.size);
    // The list names a place within the object. One of them is wrong.
    if (listed_ < end && listed_ > offset && listIsRight(offset)) [[unlikely]]
      continue;
    lastObject_ = offset;
    position_ = end;
    TESSEL_INVARIANT(end > offset);  // so the walk ends, and no entry comes twice
    if (object.type == kEntry) {
      if (take(offset)) return true;
    } else if (offset == listed_) [[unlikely]] {
      tellOfList(offset);  // or the type of the entry is wrong: finish() then misses one
      listed_ = kAny;
    }
  }
  return false;
}

// A writer lists an entry only when the entry and all objects before it are finished. So in a file
// that is being written we go no further than the list. A closed file ends where the header, the
// list and the walk agree that it ends. If they do not agree, we look at all that is left.
inline bool EntryWalk::atEnd() const {
  if (listed_ != kEnded) return false;
  const bool behindLast = position_ > file_.header().lastObject;
  if (file_.beingWritten()) return behindLast || !chain_.endedEarly();
  return behindLast && !chain_.endedEarly() && found_ >= file_.header().entryCount;
}

// Takes the entry at the place that the walk and the list agree on. False if there is none.
inline bool EntryWalk::takeListed() {
  const uint64_t size = file_.readEntry(listed_, entryEnd_, header_);
  if (size == 0) [[unlikely]]
    return false;
  lastObject_ = listed_;
  position_ = alignUp(listed_ + size);
  accept(listed_, size);
  return true;
}

// Makes the entry object at `offset` the current entry; false if it is damaged.
bool EntryWalk::take(uint64_t offset) {
  const uint64_t size = file_.readEntry(offset, entryEnd_, header_);
  if (size == 0) [[unlikely]] {
    report_.addProblem("entry damaged", offset);
    if (offset == listed_) advanceList();
    return false;
  }
  accept(offset, size);
  return true;
}

inline void EntryWalk::accept(uint64_t offset, uint64_t size) {
  TESSEL_INVARIANT(offset > entry_);  // so no entry comes twice
  // The daemon's numbers rise. Of two that do not, one is wrong, and the merge believed it.
  if (header_.sequenceNumber <= lastNumber_) [[unlikely]]
    report_.addProblem("numbers out of order", offset);
  lastNumber_ = header_.sequenceNumber;
  entry_ = offset;
  entrySize_ = size;
  firstFresh_ = std::exchange(entryEnd_, alignUp(offset + size));
  ++found_;
  if (offset == listed_) [[likely]] {
    listDiffers_ = false;
    advanceList();
  } else {
    compareWithList(offset);
  }
}

// The walk met an entry where the list names none. If one offset of the list is wrong, the next
// one is right again. If a link is wrong, the list leads to a later part of itself, and we wait
// until the walk gets there.
void EntryWalk::compareWithList(uint64_t offset) {
  if (listed_ == kAny) {
    advanceList();
    return;
  }
  if (!listDiffers_) tellOfList(offset);
  if (!std::exchange(listDiffers_, true) && listed_ != kEnded) advanceList();
}

// The list names an offset within the object at `object`. If an entry stands there, the size of the
// object is wrong, and we go on at the entry: the list says that none comes before it.
bool EntryWalk::listIsRight(uint64_t object) {
  EntryHeader entry;
  if (file_.readEntry(listed_, entryEnd_, entry) != 0 && entry.sequenceNumber > lastNumber_) {
    report_.addProblem("objects damaged", object);
    position_ = listed_;
    return true;
  }
  tellOfList(object);
  listed_ = kAny;
  return false;
}

[[gnu::always_inline]] inline void EntryWalk::advanceList() {
  listed_ = chain_.next();
  // position_ lies behind the header and behind the current entry.
  if (listed_ >= position_ && file_.mayHoldObject(listed_, kEntryItemsAt)) [[likely]]
    return;
  checkListed();
}

// The list has ended, or names a place where the next entry cannot be.
void EntryWalk::checkListed() {
  // An entry that the list named too late may come up again here.
  while (listed_ == entry_ && listed_ != 0) listed_ = chain_.next();
  if (listed_ == 0) {
    listed_ = kEnded;
    if (chain_.endedEarly()) tellOfList(chain_.problemAt());
  } else if (listed_ < position_ || !file_.mayHoldObject(listed_, kEntryItemsAt)) {
    // The file may grow while we read. What lies behind its old end was added since.
    if (found_ >= file_.header().entryCount && listed_ >= file_.objectsEnd() &&
        file_.beingWritten()) {
      listed_ = kEnded;
      return;
    }
    tellOfList(listed_);
    listed_ = kAny;
  }
}

void EntryWalk::tellOfList(uint64_t offset) { report_.addProblem("entry array damaged", offset); }

// There is no object where one should begin. The list knows best where the next entry is. Without
// it we search. False at the end of the file.
bool EntryWalk::passDamage() {
  if (position_ == listed_) {
    report_.addProblem("entry damaged", position_);
    advanceList();
    if (listed_ == kEnded && atEnd()) return false;
  } else if (listed_ < kAny) {
    report_.addProblem("objects damaged", position_);
  }
  if (listed_ >= kAny) return resynchronise(position_);
  position_ = listed_;
  return true;
}

// Finds the next object if there is none at `offset`. It may lie before `offset`, if the size of
// the last object was wrong. False if there is no further object. If only zeros are left, that is
// no damage: the daemon allocates more than it fills.
bool EntryWalk::resynchronise(uint64_t offset) {
  if (offset >= onlyZerosFrom()) return false;
  report_.addProblem("objects damaged", offset);
  uint64_t candidate = lastObject_ != 0 ? lastObject_ + kObjectHeaderSize : offset + 8;
  candidate = std::max(candidate, entryEnd_);  // what was delivered is not searched again
  while (const auto found = nextNonZero(candidate)) {
    if (makesSense(*found)) {
      position_ = *found;
      return true;
    }
    candidate = *found + 8;
  }
  return false;
}

// Whether an object begins at `offset` and something follows it that may follow an object. The six
// bytes behind its type and flags must be zero here. That keeps most garbage from being taken for
// an object.
bool EntryWalk::makesSense(uint64_t offset) {
  const ObjectHeader object = objectAt(offset);
  if (object.size == 0 || load<uint64_t>(file_.file().inWindow(offset, 8)) >> 16 != 0) return false;
  const uint64_t next = alignUp(offset + object.size);
  // While a file is being written, an object behind the last one may be unfinished.
  const uint64_t last =
      file_.header().wasBeingWritten() ? file_.header().lastObject : file_.objectsEnd();
  return next >= onlyZerosFrom() || next > last || objectBeginsAt(next);
}

// A damaged size may point anywhere. If the window went there and back for each candidate, we would
// read it whole again and again. So we read only the sixteen bytes of the header, without moving
// the window.
bool EntryWalk::objectBeginsAt(uint64_t offset) {
  if (!file_.mayHoldObject(offset, kObjectHeaderSize)) return false;
  std::array<uint8_t, kObjectHeaderSize> bytes;
  const uint8_t* at = file_.file().inWindow(offset, bytes.size());
  if (at == nullptr) {
    if (file_.file().read(offset, bytes) != bytes.size()) return false;
    at = bytes.data();
  }
  return JournalFile::objectHeader(at, file_.objectsEnd() - offset).size != 0;
}

// The offset from which the file holds nothing but zeros. We look for it once and keep it. If we
// looked at the zeros behind each candidate, damage could cost the square of the file's size.
uint64_t EntryWalk::onlyZerosFrom() {
  if (onlyZerosFrom_) return *onlyZerosFrom_;
  uint64_t from = position_;
  uint64_t offset = position_;
  while (const auto words = wordsAt(offset)) {
    for (size_t size = words->size(); size > 0; size -= 8) {
      if (load<uint64_t>(words->data() + size - 8) == 0) continue;
      from = offset + size;
      break;
    }
    offset = file_.file().nextWritten(offset + words->size());
  }
  return *(onlyZerosFrom_ = from);
}

// The eight-byte words from `offset` to the end of the window. Nothing at the end of the file, or
// soon after the stop flag was set.
std::optional<std::span<const uint8_t>> EntryWalk::wordsAt(uint64_t offset) {
  const uint64_t end = file_.objectsEnd();
  if (offset >= end || end - offset < 8 || stopped() || file_.file().at(offset, 8) == nullptr)
    return std::nullopt;
  const auto words = file_.file().restOfWindow(offset);
  return words.first(words.size() & ~size_t{7});
}

// The offset of the next eight-byte word that is not zero. An object begins with its type, so it
// cannot begin with a zero word.
std::optional<uint64_t> EntryWalk::nextNonZero(uint64_t offset) {
  while (const auto words = wordsAt(offset)) {
    for (size_t at = 0; at < words->size(); at += 8)
      if (load<uint64_t>(words->data() + at) != 0) return offset + at;
    offset = file_.file().nextWritten(offset + words->size());
  }
  return std::nullopt;
}

}  // namespace tessel
