// StoreReport: what the reader of a journal store knows about what it read and what it could not.
//
// Plain values. A report is filled by the one thread that reads and copied out for others.

#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tessel {

// Something that was wrong with a file, how often, and where it was met first.
struct FileProblem {
  std::string reason;
  uint64_t firstPlace = 0;  // byte offset in the file
  uint64_t count = 0;

  bool operator==(const FileProblem&) const = default;
};

struct FileReport {
  // Distinct reasons that are kept apart for one file; further ones are counted together.
  static constexpr size_t kMaxProblems = 32;

  std::string path;
  uint64_t entriesRead = 0;            // of those in the range
  std::optional<std::string> skipped;  // why the file was not read; absent where it was
  bool outsideRange = false;           // that is why: it has nothing for the range, and all is well
  std::vector<FileProblem> problems;

  void addProblem(std::string_view reason, uint64_t place, uint64_t count = 1);
  bool operator==(const FileReport&) const = default;
};

// Entries that the journal daemon dropped, by the unit that wrote them.
struct DroppedEntries {
  std::string unit;  // empty: the daemon named none, or one too many
  uint64_t count = 0;

  bool operator==(const DroppedEntries&) const = default;
};

struct StoreReport {
  std::vector<FileReport> files;
  uint64_t entriesRead = 0;       // with start <= realtime < end, each once
  uint64_t duplicateEntries = 0;  // left out because they stand in another file as well
  // Microseconds since 1970 of the oldest entry that the store still holds, of those read and by
  // the headers of those that were not; absent where there is none.
  std::optional<uint64_t> oldestEntry;
  uint64_t rangeStart = 0;  // microseconds since 1970
  // Jumps of the sequence number by more than one, and the numbers left out by them.
  uint64_t sequenceGaps = 0;
  uint64_t missingEntries = 0;
  std::vector<DroppedEntries> dropped;  // of no unit first, then in order of first sight
  uint64_t filesNotLookedAt = 0;        // beyond the limit on the number of files

  // Whether the store reaches back to the start of the range.
  bool reachesRangeStart() const { return oldestEntry && *oldestEntry <= rangeStart; }
  bool operator==(const StoreReport&) const = default;
};

}  // namespace tessel
