#include "trace/ExtractionReport.h"

#include <algorithm>

#include "platform/Log.h"

namespace tessel {

namespace {

void logCount(uint64_t count, std::string_view what) {
  if (count > 0) tesselReporterLog().debug("Trace store: %llu %@", count, what);
}

void logFiles(const StoreReport& store) {
  uint64_t problems = 0;
  for (const FileReport& file : store.files) {
    if (file.skipped && !file.outsideRange) {
      tesselReporterLog().debug("Trace store: %@ was not read: %@", file.path, *file.skipped);
    }
    for (const FileProblem& problem : file.problems) {
      problems += problem.count;
      tesselReporterLog().debug("Trace store: %@: %llu times %@, first at byte %llu", file.path,
                                problem.count, problem.reason, problem.firstPlace);
    }
  }
  logCount(problems, "problems in its files");
}

}  // namespace

MalformedCounts malformedCounts(const ExtractionReport& report) {
  MalformedCounts counts;
  for (size_t reason = 0; reason < kMalformedReasons; ++reason) {
    const uint64_t count = report.assembly.malformed[reason];
    if (count != 0)
      counts.emplace_back(malformedReasonText(static_cast<MalformedReason>(reason)), count);
  }
  return counts;
}

void logReport(const ExtractionReport& report) {
  if (!tesselReporterLog().isEnabled(LogLevel::debug)) return;
  for (const auto& [reason, count] : malformedCounts(report)) {
    tesselReporterLog().debug("Trace store: %llu entries are no trace points: %@", count, reason);
  }
  logCount(report.assembly.droppedOpenIntervals, "open intervals were dropped, the oldest first");
  logCount(report.beyondPairLimit,
           "objects were not delivered: too many pairs of subsystem and category");
  logCount(report.assembly.withoutImagePath, "trace points have no _EXE");
  logCount(report.store.filesNotLookedAt, "files were not looked at: too many");
  logCount(report.store.missingEntries, "sequence numbers are missing");
  for (const DroppedEntries& dropped : report.store.dropped) {
    tesselReporterLog().debug("Trace store: the journal dropped %llu entries of \"%@\"",
                              dropped.count, dropped.unit);
  }
  logFiles(report.store);
}

}  // namespace tessel
