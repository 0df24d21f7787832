// ReportingRun: one reporting run, from the tasking gate to the removal of the run marker.
//
// performReportingRun() runs on the scheduler's thread and returns when everything is done, the
// summary included. The deferral poll goes on for as long as the process lives; what it shares
// with the run is reference-counted.

#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <string_view>

#include "filter/TesselReporterObjectFilter.h"
#include "objects/TesselSupportObjectExtractor.h"
#include "platform/Activity.h"
#include "platform/Clock.h"
#include "platform/SerialQueue.h"
#include "platform/System.h"
#include "service/CookieFile.h"
#include "service/ObjectReporter.h"
#include "summary/RunSummary.h"
#include "tasking/TaskingGate.h"

namespace tessel {

// How a run ended.
enum class RunOutcome { notTasked, bailedOut, noMarker, completed, extractionFailed };

// What is known of a run when it has ended. A run that read nothing has neither filter nor
// extractor.
struct RunReport {
  RunOutcome outcome = RunOutcome::notTasked;
  Date startDate{};  // of the period read
  Date endDate{};
  std::shared_ptr<const TesselReporterObjectFilter> filter;
  std::shared_ptr<const TesselSupportObjectExtractor> extractor;
  bool interruptedByDeferral = false;
};

// Told of each run: what it is doing now, in a word or two, and how it ended.
class RunObserver {
 public:
  virtual ~RunObserver() = default;
  virtual void runReached(std::string_view step) = 0;
  virtual void objectDelivered() = 0;
  virtual void runEnded(const RunReport& report) = 0;
};

// What a run asks of its surroundings besides the parts it is wired from.
struct RunSurroundings {
  QueueFactory& queues;
  Clock& clock;
  Volumes& volumes;
  BuildVariant& buildVariant;
};

class ReportingRun {
 public:
  ReportingRun(TaskingGate& gate, CookieFile& cookie, const RunSurroundings& surroundings,
               ExtractorFactory makeExtractor, const EventRoad& road, RunSummary& summary,
               RunObserver& observer)
      : gate_(gate),
        cookie_(cookie),
        surroundings_(surroundings),
        makeExtractor_(std::move(makeExtractor)),
        road_(road),
        summary_(summary),
        observer_(observer) {}

  void performReportingRun(const std::shared_ptr<Activity>& activity);

 private:
  using InterruptedCell = std::shared_ptr<std::atomic<bool>>;

  RunReport report(const std::shared_ptr<Activity>& activity);
  std::shared_ptr<ObjectReporter> makeObjectReporter(
      const std::shared_ptr<TesselReporterObjectFilter>& filter);
  void installCallbacks(TesselSupportObjectExtractor& extractor,
                        const std::shared_ptr<ObjectReporter>& reporter);
  bool extract(TesselSupportObjectExtractor& extractor, Date startDate, Date endDate);
  void startDeferralPoll(const std::shared_ptr<Activity>& activity,
                         const InterruptedCell& interruptedByDeferral,
                         const std::shared_ptr<TesselSupportObjectExtractor>& extractor);

  TaskingGate& gate_;
  CookieFile& cookie_;
  const RunSurroundings surroundings_;
  const ExtractorFactory makeExtractor_;
  const EventRoad road_;
  RunSummary& summary_;
  RunObserver& observer_;
};

}  // namespace tessel
