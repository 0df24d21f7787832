// ExtractionReport: what one processing call found, beside what it delivered. Plain values.

#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "journal/StoreReport.h"
#include "trace/IntervalAssembler.h"

namespace tessel {

struct ExtractionReport {
  uint64_t entriesRead = 0;
  AssemblyCounts assembly;
  uint64_t delivered = 0;        // objects handed to a callback
  uint64_t pairs = 0;            // distinct (subsystem, category) among them
  uint64_t beyondPairLimit = 0;  // objects not delivered for their pair being one too many
  bool stopped = false;          // by stopProcessing() or a callback that answered false
  StoreReport store;

  uint64_t malformed(MalformedReason reason) const {
    return assembly.malformed[static_cast<size_t>(reason)];
  }
};

// Reasons in words, and how often each.
using MalformedCounts = std::vector<std::pair<std::string, uint64_t>>;
// Why entries are no trace points; the reasons that occurred.
MalformedCounts malformedCounts(const ExtractionReport& report);

// Says what was not delivered and why, and what was wrong with the store, in one debug line each.
void logReport(const ExtractionReport& report);

}  // namespace tessel
