// Two steps in turns: follow sizes from object to object, and find the next object after damage.

#include "journal/EntrySearch.h"

#include <algorithm>
#include <array>

#include "platform/Invariant.h"

namespace tessel {

using namespace journal_format;

EntrySearch::EntrySearch(JournalFile& file, uint64_t start, uint64_t end, const StopFlag& stop)
    : file_(file), stop_(stop), start_(start), end_(end), position_(start) {}

// Behind header().lastObject a file that is being written holds objects that are not finished.
bool EntrySearch::mayHoldObject(uint64_t offset) const {
  const uint64_t end = searchEnd();
  return offset <= file_.header().lastObject && offset < end && end - offset >= kObjectHeaderSize;
}

std::optional<ObjectHeader> EntrySearch::objectAt(uint64_t offset) {
  if (!mayHoldObject(offset)) return std::nullopt;
  // Computed first: reading may find that the file was cut before `offset`, and then this
  // difference would be negative.
  const uint64_t room = searchEnd() - offset;
  const uint8_t* at = file_.file().at(offset, kObjectHeaderSize);
  if (at == nullptr) return std::nullopt;
  return file_.objectHeader({at, kObjectHeaderSize}, room);
}

// A damaged size may point anywhere. Moving the window there and back for each candidate would read
// the window's size again and again, so this reads sixteen bytes without it.
bool EntrySearch::objectBeginsAt(uint64_t offset) {
  if (!mayHoldObject(offset)) return false;
  std::array<uint8_t, kObjectHeaderSize> bytes;
  const uint8_t* at = file_.file().inWindow(offset, bytes.size());
  if (at == nullptr) {
    if (file_.file().read(offset, bytes) != bytes.size()) return false;
    at = bytes.data();
  }
  return file_.objectHeader({at, bytes.size()}, searchEnd() - offset).has_value();
}

std::optional<uint64_t> EntrySearch::next() {
  while (!stop_.load(std::memory_order_relaxed)) {
    const uint64_t offset = position_;
    const auto object = objectAt(offset);
    if (!object) {
      if (!resynchronise(offset)) return std::nullopt;
      continue;
    }
    position_ = alignUp(offset + object->size);
    // Each entry is found once because the search only moves forward over objects that it accepted.
    TESSEL_INVARIANT(position_ > offset && (!lastObject_ || offset > *lastObject_));
    lastObject_ = offset;
    if (object->type != kEntry) continue;
    EntryHeader entry;
    if (file_.readEntry(offset, offset, entry) != 0) return offset;
    noteDamage(offset);
  }
  return std::nullopt;
}

void EntrySearch::noteDamage(uint64_t offset) {
  if (damagedPlaces_++ == 0) firstDamage_ = offset;
}

// Finds the next object if there is none at `offset`. It may lie before `offset`: then the size of
// the last object was wrong. False if only zeros are left, which is how an unused end looks.
bool EntrySearch::resynchronise(uint64_t offset) {
  if (offset >= onlyZerosFrom()) return false;
  noteDamage(offset);
  uint64_t candidate = lastObject_ ? *lastObject_ + kObjectHeaderSize : offset + 8;
  while (const auto found = nextNonZero(candidate)) {
    if (makesSense(*found)) {
      position_ = *found;
      return true;
    }
    candidate = *found + 8;
  }
  return false;
}

// Whether an object begins at `offset` and whether it is followed by what may follow an object.
bool EntrySearch::makesSense(uint64_t offset) {
  const auto object = objectAt(offset);
  if (!object) return false;
  const uint64_t next = alignUp(offset + object->size);
  return next >= onlyZerosFrom() || next > file_.header().lastObject || objectBeginsAt(next);
}

uint64_t EntrySearch::searchEnd() const { return std::min(end_, file_.objectsEnd()); }

// Where the zeros begin that reach to the end of the part. Following the size of each candidate
// through the zeros behind it would take the square of the file's size, so this is found once.
uint64_t EntrySearch::onlyZerosFrom() {
  if (onlyZerosFrom_) return *onlyZerosFrom_;
  uint64_t from = start_;
  uint64_t offset = start_;
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

// The eight-byte words from `offset` on that the window holds. Nothing at the end, or soon after
// the stop flag was set.
std::optional<std::span<const uint8_t>> EntrySearch::wordsAt(uint64_t offset) {
  const uint64_t end = searchEnd();
  if (offset >= end || end - offset < 8 || stop_.load(std::memory_order_relaxed) ||
      file_.file().at(offset, 8) == nullptr)
    return std::nullopt;
  const auto words = file_.file().restOfWindow(offset);
  return words.first(static_cast<size_t>(std::min<uint64_t>(words.size(), end - offset)) &
                     ~size_t{7});
}

// The offset of the next eight-byte word that is not zero: an object's first word holds its type.
std::optional<uint64_t> EntrySearch::nextNonZero(uint64_t offset) {
  while (const auto words = wordsAt(offset)) {
    for (size_t at = 0; at < words->size(); at += 8)
      if (load<uint64_t>(words->data() + at) != 0) return offset + at;
    offset = file_.file().nextWritten(offset + words->size());
  }
  return std::nullopt;
}

}  // namespace tessel
