// RunRecord: what a run came to.
//
// The run fills it, and main.cpp adds what became of the spool's rows and of the run marker. The
// record is then kept as `<state>/last_run.json`; each run replaces the record of the run before.
//
// A run that dies leaves neither a record nor the scheduler's note of its begin, because both are
// written at the end. Only the run marker tells of it. The scheduler's note is newer than the
// record where the last run was not tasked, or where its record could not be written.
//
// A plain value; one thread at a time.

#pragma once

#include <array>
#include <cstdint>
#include <numeric>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "objects/TesselReporterClassification.h"
#include "platform/Losses.h"
#include "platform/System.h"

namespace tessel {

enum class RunOutcome : uint8_t {
  completed,    // all of the period was read
  interrupted,  // a deferral ended the reading early
  bailedOut,    // the marker of a run that died stood there
  failed,       // no marker could be made, or the trace store could not be read
  notTasked,    // nothing was to be reported; such a run leaves no record
};
// Of those that a record may have.
inline constexpr std::array<std::string_view, 4> kRunOutcomeNames = {"completed", "interrupted",
                                                                     "bailed_out", "failed"};

// REQUIRES: not notTasked.
constexpr std::string_view runOutcomeName(RunOutcome outcome) {
  return kRunOutcomeNames[static_cast<size_t>(outcome)];
}

struct RunRecord {
  Date start{};
  Date end{};
  RunOutcome outcome = RunOutcome::completed;
  std::string failure;     // why it failed, in words; empty where it did not
  uint64_t logEvents = 0;  // entries read, trace points or not
  uint64_t inspected = 0;  // trace objects
  ClassifiedCounts classified{};
  uint64_t unnamed = 0;      // reported objects without a name, which send one event instead of two
  uint64_t countEvents = 0;  // sent or tried
  // Absent where nothing was read, and in records of a service that kept it in another form.
  std::optional<StoreReading> reading;

  uint64_t rowsStored = 0;                                   // in the spool
  std::vector<std::pair<std::string, uint64_t>> rowsFailed;  // by reason, zero included
  std::vector<std::string> setAside;                         // damaged spools, by file name
  std::string marker;  // what became of the run marker, in words

  // Whether the run got as far as sending anything.
  bool hasBooks() const {
    return outcome == RunOutcome::completed || outcome == RunOutcome::interrupted;
  }
  uint64_t reported() const { return classified[TesselReporterClassificationTelemetryReported]; }
  // Whether every inspected object has exactly one classification.
  bool objectsBalance() const {
    return std::accumulate(classified.begin(), classified.end(), uint64_t{0}) == inspected;
  }
  // Rows that the run should have stored: two for each object reported, one where it has no name,
  // one for each count, one for the summary.
  uint64_t rowsExpected() const { return 2 * reported() - unnamed + countEvents + 1; }
  bool rowsBalance() const { return rowsStored == rowsExpected(); }

  bool operator==(const RunRecord&) const = default;
};

}  // namespace tessel
