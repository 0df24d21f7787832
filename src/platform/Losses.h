// Losses: what was lost of a trace store, and StoreReading: what was read of it.
//
// Whoever loses something adds it here, with its words. From there the same list goes to the log,
// into the record of the run and to every command, so that all of them tell the same. Programs go
// by the code, people by the words.
//
// Words and places are kept as they were met. They may hold any bytes: whoever shows them makes
// them fit for a terminal, for JSON or for HTML.
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
  fileSkipped,          // a file that was not read; the place is its path
  filesNotLookedAt,     // files beyond the limit on their number
  fileDamaged,          // damage that was met in files; the place is the first file and the byte
  entriesMissing,       // sequence numbers that no entry has
  droppedByDaemon,      // entries that the journal daemon dropped; the place is the unit
  noImagePath,          // trace points whose executable is not known
  malformed,            // entries that mean to be trace points and are none
  openIntervalDropped,  // begins that gave way to younger ones
  beyondPairLimit,      // objects whose pair of subsystem and category was one too many
};
inline constexpr size_t kLossCodes = 9;

// "file_skipped", "files_not_looked_at" and so on, as JSON and the documentation have it.
std::string_view lossName(LossCode code);
// Nothing where no code has this name.
std::optional<LossCode> lossNamed(std::string_view name);

struct LossPlace {
  std::string name;                // a file, a unit; empty where there is none
  std::optional<uint64_t> offset;  // bytes from the start of that file

  bool operator==(const LossPlace&) const = default;
};

struct Loss {
  LossCode code{};
  uint64_t count = 0;
  std::string words;
  LossPlace place;      // where it was met first
  uint64_t places = 1;  // at how many

  // Place, offset and number of further places, such as "/a.journal, byte 8, and 2 more"; empty
  // where there is no place.
  std::string where() const;
  // Without the count: "file_skipped: Permission denied (/a.journal)".
  std::string description() const;
  // Whether it stands for all those of its code that the list had no room for.
  bool isOther() const;
  bool operator==(const Loss&) const = default;
};

class Losses {
 public:
  // Losses of one code that are told apart. Sixteen fill a screen with the other codes, and keep
  // the record of a run small.
  static constexpr size_t kMaxOfACode = 16;

  // Adds to the loss of equal code, words and place where there is one; damage is added to that of
  // equal words in any place. Beyond kMaxOfACode it is added to the "other" loss of its code. A
  // count of 0 is no loss.
  void add(Loss loss);
  void add(LossCode code, std::string_view words, const LossPlace& place, uint64_t count = 1);
  // Adds each loss of `others`.
  void add(const Losses& others);

  // By code; those of one code in order of arrival, the "other" one last.
  const std::vector<Loss>& all() const { return losses_; }
  bool empty() const { return losses_.empty(); }
  // Of all losses of the code, "other" included.
  uint64_t sum(LossCode code) const { return sums_[static_cast<size_t>(code)]; }
  // Counted under "other".
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
  // Microseconds since 1970 of the oldest entry that the store still holds, of those read and by
  // the headers of those that were not; absent where there is none.
  std::optional<uint64_t> oldestEntry;
  uint64_t rangeStart = 0;    // microseconds since 1970
  uint64_t sequenceGaps = 0;  // jumps of the sequence number by more than one
  uint64_t filesRead = 0;
  uint64_t filesOutsideRange = 0;  // left alone because all in them is of another period
  Losses losses;

  // Whether the store reaches back to the start of the period.
  bool reachesRangeStart() const { return oldestEntry && *oldestEntry <= rangeStart; }
  bool operator==(const StoreReading&) const = default;
};

}  // namespace tessel
