// RunRecord: what a run came to, kept for whoever asks later.
//
// The service writes it at the end of a run that got past the tasking gate, as
// `<state>/last_run.json`; each run replaces the record of the one before. A run that died leaves
// none, so that the record is older than the scheduler's note of the last run then.

#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "linux/ReadingDigest.h"
#include "platform/System.h"

namespace tessel {

// completed: all of the range was read; interrupted: a deferral ended it early; bailedOut: the
// marker of a run that died stood there; failed: the trace store could not be read.
enum class RunOutcome { completed, interrupted, bailedOut, failed };

// "completed", "interrupted", "bailed_out", "failed".
const char* runOutcomeName(RunOutcome outcome);

struct RunRecord {
  using Named = std::vector<std::pair<std::string, uint64_t>>;
  static constexpr size_t kClassifications = 6;
  static constexpr size_t kReported = 1;  // the classification code of what was reported

  Date start{};
  Date end{};
  RunOutcome outcome = RunOutcome::completed;
  std::string failure;     // why it failed, in words; empty where it did not
  uint64_t logEvents = 0;  // entries read, trace points or not
  uint64_t inspected = 0;  // trace objects
  std::array<uint64_t, kClassifications> classified{};  // trace objects by classification code
  uint64_t unnamed = 0;      // reported objects without a name, which send one event instead of two
  uint64_t countEvents = 0;  // sent or tried
  uint64_t rowsStored = 0;   // in the spool
  Named rowsFailed;          // by reason; kept without those that are zero
  std::vector<std::string> setAside;  // damaged spools, by file name
  Named store;                        // sums about the trace store, by name, in order
  // Absent where nothing was read, and in records of a service that did not keep it.
  std::optional<ReadingDigest> reading;
  std::string marker;  // what became of the run marker, in words

  // Takes over what the reader found: the entries, the sums and the reading.
  void addReading(const ExtractionReport& found);

  // Whether every inspected object has exactly one classification.
  bool objectsBalance() const;
  // How many rows the run should have stored.
  uint64_t rowsExpected() const;
  // Whether the spool has what the run sent: two rows an object reported, one where
  // it has no name, the counts, the summary.
  bool rowsBalance() const;

  // Less than 64 KiB, whatever the store looked like. The reason in words where that cannot be
  // written.
  std::optional<std::string> write(const std::string& stateDirectory) const;
  // Nothing where there is no record or it cannot be understood.
  static std::optional<RunRecord> read(const std::string& stateDirectory);

  bool operator==(const RunRecord&) const = default;
};

}  // namespace tessel
