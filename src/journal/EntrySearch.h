// EntrySearch: finds the entries of a stretch of a journal file object by object, without the chain
// that lists them.
//
// Where an object is not what the format allows, the search goes back to just behind the last one
// that was and tries every eighth byte from there on, until two objects in a row make sense. It
// never goes over the same stretch twice, whatever the file holds, so its time is bounded by the
// file's size.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <cstdint>
#include <optional>
#include <span>

#include "journal/JournalFile.h"

namespace tessel {

class EntrySearch {
 public:
  // Searches from `start`, where an object should begin, up to `end`, where one should end.
  // `file` and `stop` must outlive the search.
  EntrySearch(JournalFile& file, uint64_t start, uint64_t end, const StopFlag& stop);

  // The offset of the next entry; nothing at the end, or soon after the stop flag was set.
  std::optional<uint64_t> next();
  // Places where objects made no sense, and the first of them.
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
