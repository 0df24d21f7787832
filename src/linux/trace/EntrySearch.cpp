#include "linux/trace/EntrySearch.h"

#include <algorithm>

namespace tessel {

using namespace journal_format;

EntrySearch::EntrySearch(JournalFile& file, uint64_t start, uint64_t end, const StopFlag& stop)
    : file_(file), stop_(stop), end_(end), position_(start) {}

std::optional<ObjectHeader> EntrySearch::objectAt(uint64_t offset) {
  const uint64_t end = searchEnd();
  if (offset > file_.header().lastObject || offset >= end || end - offset < kObjectHeaderSize)
    return std::nullopt;
  const uint8_t* at = file_.file().at(offset, kObjectHeaderSize);
  if (at == nullptr) return std::nullopt;
  return file_.objectHeader({at, kObjectHeaderSize}, end - offset);
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
    lastObject_ = offset;
    uint64_t size = 0;
    if (object->type != kEntry) continue;
    if (file_.entryAt(offset, offset, size)) return offset;
    noteDamage(offset);
  }
  return std::nullopt;
}

void EntrySearch::noteDamage(uint64_t offset) {
  if (damagedPlaces_++ == 0) firstDamage_ = offset;
}

// Finds the next object where none is at `offset`. It may lie before: then the size of the last
// object was wrong.
bool EntrySearch::resynchronise(uint64_t offset) {
  if (!nextNonZero(offset)) return false;
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

// Whether objects begin at `offset` and where that one ends.
bool EntrySearch::makesSense(uint64_t offset) {
  const auto object = objectAt(offset);
  if (!object) return false;
  const uint64_t next = alignUp(offset + object->size);
  return next >= searchEnd() || next > file_.header().lastObject || objectAt(next).has_value() ||
         !nextNonZero(next);
}

uint64_t EntrySearch::searchEnd() const { return std::min(end_, file_.objectsEnd()); }

// The first of the eight-byte words from `offset` on that is not all zeros.
std::optional<uint64_t> EntrySearch::nextNonZero(uint64_t offset) {
  const uint64_t end = searchEnd();
  while (offset < end && end - offset >= 8 && !stop_.load(std::memory_order_relaxed)) {
    if (file_.file().at(offset, 8) == nullptr) return std::nullopt;
    auto words = file_.file().restOfWindow(offset);
    if (words.size() > end - offset) words = words.first(static_cast<size_t>(end - offset));
    for (; words.size() >= 8; words = words.subspan(8), offset += 8)
      if (load<uint64_t>(words.data()) != 0) return offset;
    offset = file_.file().nextWritten(offset);
  }
  return std::nullopt;
}

}  // namespace tessel
