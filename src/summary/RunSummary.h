// RunSummary: the books of a run, at its end.
//
// It logs six sections of counts and sends up to five count events for each, then sends one
// run-summary event and logs the closing line, and the throttle's totals if it ever slept.
//
// Threads: a summary is one job on the reporting queue, submitted after every send of the run and
// after the extraction has returned. One object serves the whole process.

#pragma once

#include <atomic>
#include <cstdint>
#include <string_view>

#include "filter/TesselReporterObjectFilter.h"
#include "platform/Analytics.h"
#include "platform/System.h"

namespace tessel {

// Handles the keys of one section: an event for each of the first five, a log line for every one.
class CountReporter {
 public:
  CountReporter(EventSender& sender, Throttle& throttle, std::string_view classification)
      : sender_(sender), throttle_(throttle), classification_(classification) {}

  // Answers the key's count. REQUIRES: `aggregation` holds `key`.
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

  // `logEvents` is how many the extractor read. `startDate` and `endDate` bound the period that was
  // read; `processingStartTime` is in ticks of the continuous clock. `interruptedByDeferral` may
  // change while the summary runs, because the deferral poll does not stop for it. Answers how many
  // count events were sent.
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
