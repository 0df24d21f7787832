// ReportingRun: one reporting run, from the tasking gate to the removal of the run marker.
//
// performReportingRun() runs on the scheduler's thread and returns when everything is done, the
// summary included. The deferral poll goes on for as long as the process lives; what it shares
// with the run is reference-counted.

#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "filter/TesselReporterObjectFilter.h"
#include "objects/TesselSupportObjectExtractor.h"
#include "platform/Queues.h"
#include "platform/RunRecord.h"
#include "platform/System.h"
#include "service/CookieFile.h"
#include "service/ObjectReporter.h"
#include "summary/RunSummary.h"
#include "tasking/TaskingGate.h"

namespace tessel {

// Given the record of each run on the run's thread, after its last step. What is not the run's to
// know, which is what the spool stored and whether the marker is gone, is left to the callback.
using RunEndedCallback = std::function<void(const RunRecord&)>;

// What a run asks of its surroundings besides the parts it is wired from.
struct RunSurroundings {
  ServiceStatus& status;
  QueueFactory& queues;
  Clock& clock;
  Volumes& volumes;
  BuildVariant& buildVariant;
};

class ReportingRun {
 public:
  ReportingRun(TaskingGate& gate, CookieFile& cookie, const RunSurroundings& surroundings,
               ExtractorFactory makeExtractor, const EventRoad& road, RunSummary& summary,
               RunEndedCallback runEnded)
      : gate_(gate),
        cookie_(cookie),
        surroundings_(surroundings),
        makeExtractor_(std::move(makeExtractor)),
        road_(road),
        summary_(summary),
        runEnded_(std::move(runEnded)) {}

  void performReportingRun(const std::shared_ptr<Activity>& activity);

 private:
  using InterruptedCell = std::shared_ptr<std::atomic<bool>>;

  RunRecord attempt(const std::shared_ptr<Activity>& activity);
  RunRecord report(const std::shared_ptr<Activity>& activity);
  std::shared_ptr<ObjectReporter> makeObjectReporter(
      const std::shared_ptr<TesselReporterObjectFilter>& filter);
  void installCallbacks(TesselSupportObjectExtractor& extractor,
                        const std::shared_ptr<ObjectReporter>& reporter);
  // Why the extraction failed, in words; nothing where it did not.
  std::optional<std::string> extract(TesselSupportObjectExtractor& extractor, Date startDate,
                                     Date endDate);
  void startDeferralPoll(const std::shared_ptr<Activity>& activity,
                         const InterruptedCell& interruptedByDeferral,
                         const std::shared_ptr<TesselSupportObjectExtractor>& extractor);

  TaskingGate& gate_;
  CookieFile& cookie_;
  const RunSurroundings surroundings_;
  const ExtractorFactory makeExtractor_;
  const EventRoad road_;
  RunSummary& summary_;
  const RunEndedCallback runEnded_;
};

}  // namespace tessel
