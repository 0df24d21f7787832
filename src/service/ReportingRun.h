// What the service does when its background activity changes state, down to one reporting run.
//
//   ReporterActivity -> ReportingRun -> TraceReading
//   state changes       gate, marker    extractor, filter, sends, summary
//
// A run is a chain of decisions that each may end it, so each link owns its own: whether to run
// now, whether the machine reports and no earlier run died half-way, and what is read and sent.
//
// Threads: everything runs on the scheduler's thread and returns when all is done, the summary
// included. Only the deferral poll has a queue of its own.

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

// The run marker, an empty file that exists exactly while a run reports. Only its existence counts:
// a marker that a new run finds says that an earlier run died half-way.
inline constexpr char cookieFilePath[] = "/var/tmp/tessel_reporter_running";
class CookieFile {
 public:
  explicit CookieFile(FileManager& files) : files_(files) {}

  // True if anything stands at the path, even a directory.
  bool cookieFileExists();
  // Removes whatever stands at the path. Logs an error if that fails.
  void clearCookieFile();
  // True only if this call made the file.
  bool createCookieFile();

 private:
  FileManager& files_;
};

// Asks an activity every ten seconds whether it should defer, and then stops the extraction.
class DeferralPoll {
 public:
  explicit DeferralPoll(QueueFactory& queues) : queues_(queues) {}

  // The answer becomes true with the first deferral. The poll goes on for as long as the process
  // lives; it keeps the activity, but not the extractor.
  std::shared_ptr<const std::atomic<bool>> start(
      const std::shared_ptr<Activity>& activity,
      const std::shared_ptr<TesselSupportObjectExtractor>& extractor);

 private:
  QueueFactory& queues_;
};

// Makes the reporter of a run, with a filter of its own.
using ReporterFactory = std::function<std::shared_ptr<ObjectReporter>()>;

// Reads the last 24 hours, reports them and sums up.
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

  // All of the record but its times and what only spool and marker know.
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

// Given the record of each run on the run's thread, after its last step. The callback adds what the
// run cannot know: what the spool stored, and whether the marker is gone.
using RunEndedCallback = std::function<void(const RunRecord&)>;

class ReportingRun {
 public:
  ReportingRun(TaskingGate& gate, CookieFile& cookie, TraceReading& reading, Clock& clock,
               ServiceStatus& status, RunEndedCallback runEnded)
      : gate_(gate),
        cookie_(cookie),
        reading_(reading),
        clock_(clock),
        status_(status),
        runEnded_(std::move(runEnded)) {}

  void performReportingRun(const std::shared_ptr<Activity>& activity);

 private:
  RunRecord attempt(const std::shared_ptr<Activity>& activity);

  TaskingGate& gate_;
  CookieFile& cookie_;
  TraceReading& reading_;
  Clock& clock_;
  ServiceStatus& status_;
  const RunEndedCallback runEnded_;
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
