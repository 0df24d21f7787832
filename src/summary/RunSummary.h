// RunSummary: accounts for all objects of a run when the run ends.
//
// It logs six sections of counts and sends up to five count events for each section. Then it sends
// one run-summary event and logs the closing line. If the throttle ever slept, it also logs for how
// long.
//
// Threads: a summary is one job on the reporting queue. It is submitted after the extraction has
// returned, and so after every send of the run. One object serves the whole process.

#pragma once

#include <atomic>
#include <cstdint>
#include <string_view>

#include "filter/TesselReporterObjectFilter.h"
#include "platform/Analytics.h"
#include "platform/System.h"

namespace tessel {

// Reports the keys of one section. The first five get an event each; every key gets a log line.
class CountReporter {
 public:
  CountReporter(EventSender& sender, Throttle& throttle, std::string_view classification)
      : sender_(sender), throttle_(throttle), classification_(classification) {}

  // Returns the count of the key. REQUIRES: `key` is a key of `aggregation`, not a copy.
  uint64_t reportCountForKey(const TesselReporterAggregationKey& key,
                             const TesselReporterAggregation& aggregation);
  // Events sent so far.
  uint64_t sentCount() const { return sentCount_; }

 private:
  EventSender& sender_;
  Throttle& throttle_;
  const std::string_view classification_;
  uint64_t sentCount_ = 0;
};

class RunSummary {
 public:
  RunSummary(EventSender& sender, Throttle& throttle, Clock& clock, DateFormatter& dates,
             ServiceStatus& status)
      : sender_(sender), throttle_(throttle), clock_(clock), dates_(dates), status_(status) {}

  // `logEvents` is the number of log events that the extractor read. `startDate` and `endDate`
  // bound the period. `processingStartTime` is in ticks of the continuous clock. The deferral poll
  // goes on during the summary, so `interruptedByDeferral` may change meanwhile. Returns the number
  // of count events sent.
  uint64_t reportRunSummary(const TesselReporterObjectFilter& filter, uint64_t logEvents,
                            Date startDate, Date endDate,
                            const std::atomic<bool>& interruptedByDeferral,
                            uint64_t processingStartTime);

 private:
  uint64_t reportSections(const TesselReporterObjectFilter& filter);
  float secondsSince(uint64_t startTime);

  EventSender& sender_;
  Throttle& throttle_;
  Clock& clock_;
  DateFormatter& dates_;
  ServiceStatus& status_;
};

}  // namespace tessel
