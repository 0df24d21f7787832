// Losses: what was lost of a trace store. StoreReading: what was read of it.
//
// The part that loses something adds it here and describes it in words. The log, the record of the
// run and every command show this one list, so they cannot disagree. Programs go by the code,
// people by the words.
//
// Words and places are kept unchanged and may hold any bytes. The code that shows them escapes them
// for a terminal, for JSON or for HTML.
//
// Plain values; one thread at a time.

#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tessel {

// In the order in which losses are shown.
enum class LossCode : uint8_t {
  fileSkipped,       // files that were not read; the place is the path
  filesNotLookedAt,  // files beyond the limit on their number
  fileDamaged,       // damaged spots in files; the place is the first file and its byte
  entriesMissing,    // numbers that no file holds, or entries of a removed file
  droppedByDaemon,   // entries that the journal daemon dropped; the place is the unit
  noImagePath,       // trace points whose executable is not known
  malformed,         // entries with the mark of a trace point but bad fields
  // From here on each loss belongs to a writer. Its place is his executable, and his user.
  lostAtSource,  // trace points of the period that the program could not hand to the journal
  lostEarlier,   // such points of a program that began to lose before the period, up to its first
                 // entry in it
  // From here on the writer had more than his share.
  openIntervalDropped,  // begins that were dropped to make room for younger ones
  beyondPairLimit,      // objects whose pair of subsystem and category was not kept
  beyondImageLimit,     // objects of an executable that was not kept
  beyondTextLimit,      // objects for whose rows the spool had no room left
  beyondTimeLimit,      // objects for which the run had no time left
};
inline constexpr size_t kLossCodes = 14;

// Whether losses of the code belong to a writer.
constexpr bool isOfWriter(LossCode code) {
  return code >= LossCode::lostAtSource && code <= LossCode::beyondTimeLimit;
}
// Whether that writer had more than his share.
constexpr bool isOverShare(LossCode code) {
  return code >= LossCode::openIntervalDropped && code <= LossCode::beyondTimeLimit;
}

// The name in JSON and in the documentation, such as "file_skipped".
std::string_view lossName(LossCode code);
// Absent if no code has this name.
std::optional<LossCode> lossNamed(std::string_view name);

struct LossPlace {
  std::string name;                   // of a file, a unit or an executable; empty if there is none
  std::optional<uint64_t> offset;     // bytes from the start of that file
  std::optional<uint32_t> user = {};  // of a writer; absent if nobody knows it

  bool operator==(const LossPlace&) const = default;
};

struct Loss {
  LossCode code{};
  uint64_t count = 0;
  std::string words;
  LossPlace place;      // the first of its places
  uint64_t places = 1;  // how many places it has

  // Place, offset and number of further places, such as "/a.journal, byte 8, and 2 more". Empty if
  // there is no place.
  std::string where() const;
  // Everything but the count: "file_skipped: Permission denied (/a.journal)".
  std::string description() const;
  // Whether it is the sum of the losses of its code that the list had no room for.
  bool isOther() const;
  bool operator==(const Loss&) const = default;
};

class Losses {
 public:
  // How many losses of one code are listed one by one. Sixteen still fit on a screen beside the
  // losses of the other codes, and they keep the record of a run small.
  static constexpr size_t kMaxOfACode = 16;

  // Adds a loss. If the list has one with the same code, words and place name, their counts are
  // summed; for damage the place does not matter. If kMaxOfACode losses of the code are listed
  // already, the "other" loss of that code takes the count. A count of 0 changes nothing.
  void add(Loss loss);
  void add(LossCode code, std::string_view words, const LossPlace& place, uint64_t count = 1);
  // Adds each loss of `others`.
  void add(const Losses& others);

  // Sorted by code. Losses of one code stand in order of arrival, with the "other" loss last.
  const std::vector<Loss>& all() const { return losses_; }
  bool empty() const { return losses_.empty(); }
  // The count of all losses of the code, "other" included.
  uint64_t sum(LossCode code) const { return sums_[static_cast<size_t>(code)]; }
  // The part of sum() that stands under "other".
  uint64_t notListed(LossCode code) const;

  bool operator==(const Losses&) const = default;

 private:
  std::vector<Loss> losses_;
  std::array<uint64_t, kLossCodes> sums_{};
};

// What was read of a trace store for one period, and what was lost of it.
struct StoreReading {
  uint64_t entriesRead = 0;       // of the period, each once
  uint64_t duplicateEntries = 0;  // left out because they stand in another file as well
  // The oldest entry that the store still holds, in microseconds since 1970. For a file that was
  // not read, its header tells. Absent if there is no entry.
  std::optional<uint64_t> oldestEntry;
  uint64_t rangeStart = 0;      // microseconds since 1970
  uint64_t sequenceGaps = 0;    // rows of numbers between others that no file holds
  uint64_t missingNumbers = 0;  // in all gaps; a loss only if `losses` tells of one
  uint64_t filesRead = 0;
  uint64_t filesOutsideRange = 0;  // not read, because all their entries are of another period
  static constexpr size_t kMaxNamed = 16;  // fit on a screen
  std::vector<std::string> outsideRange;   // the paths of the first kMaxNamed of these
  Losses losses;
  bool stopped = false;                    // before the end of the period was reached
  uint64_t rangeEnd = 0;                   // microseconds since 1970
  std::optional<uint64_t> lastEntry = {};  // the last that was read, in microseconds since 1970

  // The end of the period that a stop left unread, in microseconds. 0 if everything was read.
  uint64_t unread() const;
  // Whether the store reaches back to the start of the period.
  bool reachesRangeStart() const { return oldestEntry && *oldestEntry <= rangeStart; }
  bool operator==(const StoreReading&) const = default;
};

}  // namespace tessel
