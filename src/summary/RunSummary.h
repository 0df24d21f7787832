// RunSummary: the books of a run, at its end.
//
// Six sections of counts in the log, up to five count events each, one run-summary event, the
// closing line, and the throttle's totals where it ever slept. Runs as one job on the reporting
// queue, after every send of the run and after the extraction has returned. One object serves the
// whole process.

#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>

#include "filter/TesselReporterObjectFilter.h"
#include "objects/TesselSupportObjectExtractor.h"
#include "platform/Analytics.h"
#include "platform/System.h"

namespace tessel {

class RunSummary {
 public:
  RunSummary(EventSender& sender, Throttle& throttle, Clock& clock, DateFormatter& dates,
             ServiceStatus& status)
      : sender_(sender), throttle_(throttle), clock_(clock), dates_(dates), status_(status) {}

  // `startDate` and `endDate` bound the period that was read; `processingStartTime` is in ticks of
  // the continuous clock. `interruptedByDeferral` may still change while the summary runs.
  // Answers how many count events it sent.
  uint64_t reportRunSummary(const TesselReporterObjectFilter& filter,
                            const TesselSupportObjectExtractor& extractor, Date startDate,
                            Date endDate, const std::atomic<bool>& interruptedByDeferral,
                            uint64_t processingStartTime);

 private:
  uint64_t reportSections(const TesselReporterObjectFilter& filter);
  float secondsSince(uint64_t startTime);

  EventSender& sender_;
  Throttle& throttle_;
  Clock& clock_;
  DateFormatter& dates_;
  ServiceStatus& status_;
  std::once_flag factorMade_;
  double secondsPerTick_ = 0;
};

}  // namespace tessel
