// The wiring of the service, in the order in which its parts need each other.

#include "service/Composition.h"

#include <deque>

#include "linux/AppBundles.h"
#include "linux/Findings.h"
#include "linux/RunRecordFile.h"
#include "linux/SystemFacts.h"
#include "platform/Log.h"
#include "platform/Queues.h"
#include "service/ReportingRun.h"
#include "statora/Spool.h"
#include "trace/JournalExtractor.h"

namespace tessel {
namespace {

// Makes a T that lives as long as the process. The list points to it, because a leak checker
// reports an object that nothing points to.
template <typename T, typename... Args>
T& keep(Args&&... args) {
  static auto& kept = *new std::deque<T*>;
  return *kept.emplace_back(new T(std::forward<Args>(args)...));
}

void addRows(RunRecord& record, const SpoolFigures& figures) {
  record.rowsStored = figures.stored;
  record.rowsExpired = figures.expired;
  record.setAside = figures.setAside;
  for (size_t kind = 0; kind < kSpoolFailureKinds; ++kind) {
    record.rowsFailed.emplace_back(spoolFailureName(static_cast<SpoolFailure>(kind)),
                                   figures.failed[kind]);
  }
}

// Writes the record of a run for `tesselctl status`. The spool knows how many rows it stored only
// when the run has ended, which takes as long as the disk needs.
void keepRecord(RunRecord record, Spool& spool, const LaunchConfiguration& launch,
                const Outside& outside) {
  const std::string& stateDirectory = outside.state.path();
  const SpoolFigures figures = spool.endRun();
  const std::optional<RunRecord> last = readRunRecord(stateDirectory);
  if (record.outcome == RunOutcome::notTasked) {
    // Such a run leaves no record of its own. But rows may have expired, and those are counted.
    if (!last || figures.expired == 0) return;
    record = *last;
    record.totals.expired += figures.expired;
    record.expiredSince += figures.expired;
  } else {
    addRows(record, figures);
    record.addTotals(last ? last->totals : RowTotals{});
    record.marker = outside.files.existence(cookieFilePath).exists ? "still there" : "removed";
    record.interval = launch.activityInterval;
    logFindings(record);
  }
  if (const auto failure = writeRunRecord(record, stateDirectory)) {
    platformLog().warning("The record of the run is not written: %@", failure->words);
  }
}

RunBook bookOfRuns(const LaunchConfiguration& launch, const Outside& outside, Spool& spool,
                   SerialQueue& reportingQueue) {
  const std::string taskingFile = launch.configurationDirectory + "/" + kTaskingType + ".json";
  return {[&state = outside.state, taskingFile](Date begun) {
            // If this fails, the end of the run most likely cannot be written either, and that is a
            // warning.
            writeRunBegin(begun, taskingFile, state.path());
          },
          [launch, outside, &spool, &reportingQueue](const RunRecord& record) {
            // Only this queue may use the spool; all sends run there, too.
            reportingQueue.sync([&] { keepRecord(record, spool, launch, outside); });
          }};
}

// Makes the parts that take an object from the store to the spool.
TraceReading& makeReading(const LaunchConfiguration& launch, const Outside& outside,
                          BuildVariant& variant, Spool& spool, QueueFactory& queues,
                          SerialQueue& reportingQueue) {
  Clock& clock = outside.clock;
  ServiceStatus& status = outside.manager;
  auto& throttle = keep<Throttle>(clock, outside.threads);
  auto& road = keep<EventRoad>(throttle, spool, reportingQueue);
  auto& volumes = keep<MountTable>();
  auto& identity = keep<ProcessIdentity>(keep<AppBundles>(volumes));
  auto& summary = keep<RunSummary>(spool, throttle, clock, keep<IcuDates>(), status);
  ExtractionLimits limits;
  limits.shares.spaceOfRow = &spaceOfRow;
  if (launch.runLimit.count() != 0)
    limits.shares.nanoseconds =
        static_cast<uint64_t>(std::chrono::nanoseconds(launch.runLimit).count());
  const auto makeExtractor = [store = launch.traceStore, limits, &status, &throttle, &road, &clock,
                              &spool, &reportingQueue]() mutable {
    // Only this queue may use the spool.
    reportingQueue.sync([&] { limits.shares.rowBytes = spool.beginRun(); });
    // The poll of a past run keeps a weak reference. make_shared() puts the object and its counter
    // into one block, so a weak reference would keep the memory of the whole extractor.
    std::shared_ptr<JournalExtractor> extractor(new JournalExtractor(store, limits));
    extractor->reportProgressTo(status);
    extractor->chargeBy(clock, [&throttle, &road] {
      return Spending{throttle.stepCount(), throttle.sleptTicks(), road.queuedBytes()};
    });
    return extractor;
  };
  const auto makeReporter = [&variant, &volumes, &identity, &road] {
    return std::make_shared<ObjectReporter>(TesselReporterObjectFilter::init(variant),
                                            bootVolumeFacts(volumes), identity, road);
  };
  return keep<TraceReading>(makeExtractor, makeReporter, keep<DeferralPoll>(queues), summary,
                            reportingQueue, clock, status);
}

ReportingRun& makeRun(const LaunchConfiguration& launch, const Outside& outside) {
  Clock& clock = outside.clock;
  Threads& threads = outside.threads;
  ServiceStatus& status = outside.manager;
  auto& reportingQueue = keep<WorkerQueue>("tessel_reporter Statora reporting queue", threads);
  auto& queues = keep<WorkerQueueFactory>(threads);
  auto& variant = keep<OsReleaseBuildVariant>(launch.osReleasePath);
  auto& gate = keep<TaskingGate>(variant, outside.configurations, queues, threads);
  const auto writerQueue =
      std::make_shared<WorkerQueue>("tessel_reporter spool writer queue", threads);
  const SpoolLimits limits{launch.spoolLimitBytes, launch.spoolDays};
  auto& spool = keep<Spool>(outside.state.path(), limits, clock, status, writerQueue, queues);
  auto& reading = makeReading(launch, outside, variant, spool, queues, reportingQueue);
  return keep<ReportingRun>(gate, keep<CookieFile>(outside.files), reading, clock, status,
                            bookOfRuns(launch, outside, spool, reportingQueue));
}

}  // namespace

ServiceRuntime& startService(const LaunchConfiguration& launch, const Outside& outside) {
  auto& runtime = keep<ServiceRuntime>(outside.manager, outside.threads);
  auto& activity = keep<ReporterActivity>(runtime, makeRun(launch, outside));
  auto& scheduler = keep<BackgroundScheduler>(
      ScheduleCriteria{launch.activityInterval, launch.deferRetry, launch.runLimit,
                       launch.deferLimit},
      outside.state, outside.conditions, runtime, outside.manager, outside.clock, outside.threads);
  scheduler.registerActivity(kActivityName, [&activity](const std::shared_ptr<Activity>& changed) {
    activity.handleActivity(changed);
  });
  return runtime;
}

}  // namespace tessel
