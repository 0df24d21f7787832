// ReportingRun: one reporting run, and the change of activity state that starts it.
//
//   ReporterActivity -> ReportingRun -> TraceReading
//   state changes       gate, marker    extractor, filter, sends, summary
//
// Each of the three classes takes one decision. ReporterActivity decides whether to run now.
// ReportingRun decides whether this machine may report, and whether the run before died half-way.
// TraceReading then reads, reports and sums up.
//
// Threads: a run blocks the scheduler's thread until the summary is done. Sends and summary run on
// the reporting queue, and the deferral poll on a queue of its own.

#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "objects/RunRecord.h"
#include "objects/TesselSupportObjectExtractor.h"
#include "platform/Queues.h"
#include "platform/System.h"
#include "service/ObjectReporter.h"
#include "summary/RunSummary.h"
#include "tasking/TaskingGate.h"

namespace tessel {

inline constexpr char kActivityName[] = "com.vantor.tessel.tessel_reporter_activity";

// The run marker is an empty file that exists while a run reports. If a new run finds a marker, an
// earlier run died half-way. Only the existence of the file counts.
inline constexpr char cookieFilePath[] = "/var/tmp/tessel_reporter_running";
class CookieFile {
 public:
  explicit CookieFile(FileManager& files) : files_(files) {}

  // True if there is anything at the path, even a directory.
  bool cookieFileExists();
  // Removes whatever is at the path. Logs an error if that fails.
  void clearCookieFile();
  // Absent if this call made the file. It fails if there was a marker already.
  std::optional<PlatformError> createCookieFile();

 private:
  FileManager& files_;
};

// Asks an activity every ten seconds whether it should defer. If so, stops the extraction.
class DeferralPoll {
 public:
  explicit DeferralPoll(QueueFactory& queues) : queues_(queues) {}

  // The returned value becomes true at the first deferral and stays true. The poll goes on until
  // the process ends. It keeps the activity alive, but not the extractor.
  std::shared_ptr<const std::atomic<bool>> start(
      const std::shared_ptr<Activity>& activity,
      const std::shared_ptr<TesselSupportObjectExtractor>& extractor);

 private:
  QueueFactory& queues_;
};

// Makes the reporter of a run, with a filter of its own.
using ReporterFactory = std::function<std::shared_ptr<ObjectReporter>()>;

// Reads the trace points of the last 24 hours, reports them and sums up.
class TraceReading {
 public:
  // `runSummary` runs on `reportingQueue`.
  TraceReading(ExtractorFactory makeExtractor, ReporterFactory makeReporter, DeferralPoll& poll,
               RunSummary& summary, SerialQueue& reportingQueue, Clock& clock,
               ServiceStatus& status)
      : makeExtractor_(std::move(makeExtractor)),
        makeReporter_(std::move(makeReporter)),
        poll_(poll),
        summary_(summary),
        reportingQueue_(reportingQueue),
        clock_(clock),
        status_(status) {}

  // Fills the whole record except for the times and for what only the spool and the marker show.
  RunRecord report(const std::shared_ptr<Activity>& activity);

 private:
  void installCallbacks(TesselSupportObjectExtractor& extractor,
                        const std::shared_ptr<ObjectReporter>& reporter);

  const ExtractorFactory makeExtractor_;
  const ReporterFactory makeReporter_;
  DeferralPoll& poll_;
  RunSummary& summary_;
  SerialQueue& reportingQueue_;
  Clock& clock_;
  ServiceStatus& status_;
};

// What keeps the books of the runs. Both are called on the run's thread.
struct RunBook {
  // Before a run that is tasked does anything else, with its begin. If the run then dies, the begin
  // tells that there was one.
  std::function<void(Date)> begun;
  // With the record of each run, after its last step. It adds what the run cannot know: what the
  // spool stored, and whether the marker is gone. A run that was not tasked ends without a begin.
  std::function<void(const RunRecord&)> ended;
};

class ReportingRun {
 public:
  ReportingRun(TaskingGate& gate, CookieFile& cookie, TraceReading& reading, Clock& clock,
               ServiceStatus& status, RunBook book)
      : gate_(gate),
        cookie_(cookie),
        reading_(reading),
        clock_(clock),
        status_(status),
        book_(std::move(book)) {}

  void performReportingRun(const std::shared_ptr<Activity>& activity);

 private:
  RunRecord attempt(const std::shared_ptr<Activity>& activity, Date began);

  TaskingGate& gate_;
  CookieFile& cookie_;
  TraceReading& reading_;
  Clock& clock_;
  ServiceStatus& status_;
  const RunBook book_;
};

class ReporterActivity {
 public:
  ReporterActivity(Runtime& runtime, ReportingRun& run) : runtime_(runtime), run_(run) {}

  // The scheduler calls it on a thread of its own, never twice at a time. Blocks for a whole run.
  void handleActivity(const std::shared_ptr<Activity>& changed);

 private:
  void runOrDefer(const std::shared_ptr<Activity>& activity);

  Runtime& runtime_;
  ReportingRun& run_;
};

}  // namespace tessel
