// Two steps that alternate: follow the sizes from object to object, and find the next object after
// damage.

#include "journal/EntrySearch.h"

#include <algorithm>
#include <array>

#include "platform/Invariant.h"

namespace tessel {

using namespace journal_format;

EntrySearch::EntrySearch(JournalFile& file, uint64_t start, uint64_t end, const StopFlag& stop)
    : file_(file), stop_(stop), start_(start), end_(end), position_(start) {}

// While a file is being written, an object behind header().lastObject may be unfinished.
bool EntrySearch::mayHoldObject(uint64_t offset) const {
  const uint64_t end = searchEnd();
  return offset <= file_.header().lastObject && offset < end && end - offset >= kObjectHeaderSize;
}

std::optional<ObjectHeader> EntrySearch::objectAt(uint64_t offset) {
  if (!mayHoldObject(offset)) return std::nullopt;
  // Computed before at(): reading may find that the file was cut before `offset`. searchEnd() then
  // moves, and this difference would be negative.
  const uint64_t room = searchEnd() - offset;
  const uint8_t* at = file_.file().at(offset, kObjectHeaderSize);
  if (at == nullptr) return std::nullopt;
  return file_.objectHeader({at, kObjectHeaderSize}, room);
}

// A damaged size may point anywhere. If the window went there and back for each candidate, we would
// read it whole again and again. So we read only the sixteen bytes of the header, without moving
// the window.
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

// Finds the next object if there is none at `offset`. It may lie before `offset`, if the size of
// the last object was wrong. False if there is no further object. If only zeros are left, that is
// no damage: the daemon allocates more than it fills.
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

// Whether an object begins at `offset` and something follows it that may follow an object.
bool EntrySearch::makesSense(uint64_t offset) {
  const auto object = objectAt(offset);
  if (!object) return false;
  const uint64_t next = alignUp(offset + object->size);
  return next >= onlyZerosFrom() || next > file_.header().lastObject || objectBeginsAt(next);
}

uint64_t EntrySearch::searchEnd() const { return std::min(end_, file_.objectsEnd()); }

// The offset from which the part holds nothing but zeros. We look for it once and keep it. If we
// looked at the zeros behind each candidate, damage could cost the square of the file's size.
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

// The eight-byte words from `offset` to the end of the window. Nothing at the end of the part, or
// soon after the stop flag was set.
std::optional<std::span<const uint8_t>> EntrySearch::wordsAt(uint64_t offset) {
  const uint64_t end = searchEnd();
  if (offset >= end || end - offset < 8 || stop_.load(std::memory_order_relaxed) ||
      file_.file().at(offset, 8) == nullptr)
    return std::nullopt;
  const auto words = file_.file().restOfWindow(offset);
  return words.first(static_cast<size_t>(std::min<uint64_t>(words.size(), end - offset)) &
                     ~size_t{7});
}

// The offset of the next eight-byte word that is not zero. An object begins with its type, so it
// cannot begin with a zero word.
std::optional<uint64_t> EntrySearch::nextNonZero(uint64_t offset) {
  while (const auto words = wordsAt(offset)) {
    for (size_t at = 0; at < words->size(); at += 8)
      if (load<uint64_t>(words->data() + at) != 0) return offset + at;
    offset = file_.file().nextWritten(offset + words->size());
  }
  return std::nullopt;
}

}  // namespace tessel
