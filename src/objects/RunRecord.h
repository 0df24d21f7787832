// RunRecord: the result of one run, with all its counts.
//
// The run fills it, and the composition adds what became of the spool's rows and of the run marker.
// It is then kept as `<state>/last_run.json`; each run replaces the record of the run before.
//
// RunNote: begin and end of a run. The note is written before the run begins, so a run that dies
// leaves one without an end. The file keeps the notes of the last runs beside the record.
//
// A run that was not tasked leaves neither. The scheduler's note of it is then newer than ours.
//
// Plain values; one thread at a time.

#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <map>
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
  completed,    // the whole period was read
  interrupted,  // a stop ended the reading early
  bailedOut,    // the run found the marker of a run that had died, and read nothing
  failed,       // the marker could not be made, or the trace store could not be read
  notTasked,    // this machine was not to report; such a run leaves no record
};
// The names of all outcomes but notTasked, which no record has.
inline constexpr std::array<std::string_view, 4> kRunOutcomeNames = {"completed", "interrupted",
                                                                     "bailed_out", "failed"};

// REQUIRES: not notTasked.
constexpr std::string_view runOutcomeName(RunOutcome outcome) {
  return kRunOutcomeNames[static_cast<size_t>(outcome)];
}

// Rows that no forwarder will deliver, over all runs since the first one that left a record. They
// stand in the record and not in the spool: a spool that refuses rows may refuse the count as well.
struct RowTotals {
  uint64_t expired = 0;
  std::map<std::string, uint64_t> failed;  // by reason; none that never occurred

  bool operator==(const RowTotals&) const = default;
};

// The sums of a run by which a receiver of its rows can check that it has all of them.
struct RunSums {
  uint64_t inspected = 0;  // trace objects
  uint64_t sent = 0;       // rows handed to the spool
  uint64_t stored = 0;     // of them: in the spool
  uint64_t refused = 0;    // of them: not stored, whatever the reason

  bool operator==(const RunSums&) const = default;
};

struct RunRecord {
  Date start{};
  Date end{};
  RunOutcome outcome = RunOutcome::completed;
  std::string failure;     // why the run failed, in words; empty if it did not
  uint64_t logEvents = 0;  // entries read, trace points or not
  uint64_t inspected = 0;  // trace objects
  ClassifiedCounts classified{};
  uint64_t unnamed = 0;      // reported objects without a full name: one event each, not two
  uint64_t unsendable = 0;   // reported objects of which no payload could be made: no event
  uint64_t countEvents = 0;  // handed to the spool, stored or not
  // Absent if nothing was read, or if the file has the reading in a form that we do not know.
  std::optional<StoreReading> reading;

  uint64_t rowsStored = 0;   // in the spool
  uint64_t rowsExpired = 0;  // of earlier runs, removed because they had stood there too long
  std::vector<std::pair<std::string, uint64_t>> rowsFailed;  // every reason, also those with 0 rows
  std::vector<std::string> setAside;                         // file names of damaged spools
  std::string marker;                                        // "removed" or "still there"
  RowTotals totals;                                          // this run's rows included
  // Rows that runs after this one removed because of their age. They were not tasked, so they have
  // no record of their own.
  uint64_t expiredSince = 0;
  // The setting of the service, which whoever reads the record need not have. Absent if something
  // else starts each run, and in the record of an older service.
  std::optional<std::chrono::seconds> interval;

  // Whether the run got as far as sending anything.
  bool hasBooks() const {
    return outcome == RunOutcome::completed || outcome == RunOutcome::interrupted;
  }
  uint64_t reported() const { return classified[TesselReporterClassificationTelemetryReported]; }
  uint64_t classifiedSum() const {
    return std::accumulate(classified.begin(), classified.end(), uint64_t{0});
  }
  // Whether every inspected object has exactly one classification.
  bool objectsBalance() const { return classifiedSum() == inspected; }
  // Rows that the run should have stored. A reported object makes two, or one if it lacks a full
  // name, or none if it has no payload. Each count event makes one, and so does the summary.
  uint64_t rowsExpected() const {
    return 2 * (reported() - unsendable) - unnamed + countEvents + 1;
  }
  bool rowsBalance() const { return rowsStored == rowsExpected(); }
  RunSums sums() const {
    uint64_t refused = 0;
    for (const auto& [reason, count] : rowsFailed) refused += count;
    // A run without books sends no row. The formula would still expect the row of the summary.
    return {inspected, hasBooks() ? rowsExpected() : 0, rowsStored, refused};
  }
  // Sets the totals from those of the run before.
  void addTotals(RowTotals before) {
    totals = std::move(before);
    totals.expired += rowsExpired;
    for (const auto& [reason, count] : rowsFailed) {
      if (count != 0) totals.failed[reason] += count;
    }
  }

  bool operator==(const RunRecord&) const = default;
};

struct RunNote {
  Date start{};
  // Both are absent while the run is under way, and for ever if it died.
  std::optional<Date> end;
  std::optional<RunOutcome> outcome;
  // The boot that it ran in, and when that boot began by the wall clock of that moment. If the
  // clock is set, the same boot seems to begin at another time: by that we notice it. Empty and
  // absent in what an older service wrote.
  std::string boot;
  std::optional<Date> bootBegan;
  // When the file that switches reporting on was written. Absent if there is none.
  std::optional<Date> taskingWritten;
  // Absent while the run is under way, if it died, and in what an older service wrote.
  std::optional<RunSums> sums;

  // Whether the run did what it is for. What an interrupted run has read, it has reported.
  bool reported() const {
    return outcome == RunOutcome::completed || outcome == RunOutcome::interrupted;
  }
  bool operator==(const RunNote&) const = default;
};

struct RunHistory {
  // Nobody can tell the collector of a run whose note is gone, and the forwarder may be away for
  // long. So the notes reach back eight months of daily runs, and each run writes the file twice:
  // 256 notes make it 90 KiB longer.
  static constexpr size_t kMaxRuns = 256;

  std::vector<RunNote> runs;      // the last ones, oldest first
  uint64_t begun = 0;             // runs that were ever noted: the number of the last one
  std::optional<RunRecord> last;  // of the last run that came to its end

  bool operator==(const RunHistory&) const = default;
};

}  // namespace tessel
