// EntrySearch: finds entries in a part of a journal file without the list of entries, by looking at
// every object.
//
// The reader uses it where an entry array is damaged. The search steps from object to object by
// their sizes. If there is no valid object where one should begin, the size of the last object may
// have been wrong. The search then goes back to just behind the header of that object and tries
// every eighth byte, because objects begin at multiples of eight.
//
// Random bytes often look like an object. So a place counts only if the object there is followed by
// another object, by zeros up to the end, or by the end of what was written. If we asked for three
// objects in a row, we would find fewer entries behind damage. If we asked for one alone, we would
// find entries that never existed.
//
// It delivers entries in rising order, each once. Its time is proportional to the size of the part,
// whatever the file holds: it never goes back before an object that it accepted, and it looks for
// the zeros at the end only once.
//
// Threads: one at a time, except for the stop flag.

#pragma once

#include <cstdint>
#include <optional>
#include <span>

#include "journal/JournalFile.h"

namespace tessel {

class EntrySearch {
 public:
  // Searches from `start`, where an object should begin, to `end`, where one should end.
  // `file` and `stop` must outlive the search.
  EntrySearch(JournalFile& file, uint64_t start, uint64_t end, const StopFlag& stop);

  // The offset of the next entry. Nothing at the end, or soon after the stop flag was set.
  std::optional<uint64_t> next();
  // In how many places there was no valid object or entry where one should be; firstDamage() is the
  // offset of the first such place.
  uint64_t damagedPlaces() const { return damagedPlaces_; }
  uint64_t firstDamage() const { return firstDamage_; }

 private:
  bool mayHoldObject(uint64_t offset) const;
  std::optional<ObjectHeader> objectAt(uint64_t offset);
  bool objectBeginsAt(uint64_t offset);
  bool resynchronise(uint64_t offset);
  bool makesSense(uint64_t offset);
  std::optional<uint64_t> nextNonZero(uint64_t offset);
  std::optional<std::span<const uint8_t>> wordsAt(uint64_t offset);
  uint64_t onlyZerosFrom();
  uint64_t searchEnd() const;
  void noteDamage(uint64_t offset);

  JournalFile& file_;
  const StopFlag& stop_;
  const uint64_t start_;
  const uint64_t end_;
  uint64_t position_;
  std::optional<uint64_t> lastObject_;
  std::optional<uint64_t> onlyZerosFrom_;
  uint64_t damagedPlaces_ = 0;
  uint64_t firstDamage_ = 0;
};

}  // namespace tessel
