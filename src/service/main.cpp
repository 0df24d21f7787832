// Composition root of the service: makes every part, in order, and hands each what it needs.
//
// We never destroy a part. The process may end at any moment and on any thread, and the other
// threads must not use a part that is half destroyed. The service takes its configuration from the
// environment and ignores its arguments.

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <deque>

#include "linux/AppBundles.h"
#include "linux/Findings.h"
#include "linux/LaunchConfiguration.h"
#include "linux/LogSinks.h"
#include "linux/RunRecordFile.h"
#include "linux/Scheduler.h"
#include "linux/ServiceRuntime.h"
#include "linux/StateDirectory.h"
#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "platform/Queues.h"
#include "service/ReportingRun.h"
#include "statora/ConfigurationFiles.h"
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

[[noreturn]] void refuse(int status, const std::string& line) {
  std::fprintf(stderr, "tessel_reporter: %s\n", line.c_str());
  std::exit(status);
}

LaunchConfiguration launchConfiguration() {
  auto read = readLaunchConfiguration(processEnvironment());
  if (const auto* error = std::get_if<LaunchError>(&read))
    refuse(kExitConfiguration, error->line());
  return std::get<LaunchConfiguration>(std::move(read));
}

// With too few descriptors every part would fail in a way of its own, and some of them silently: a
// configuration that cannot be opened looks like one that is not there. The run of a single small
// file has 8 open at a time; half of the limit is left to the files of the journal.
void requireDescriptors() {
  constexpr size_t kNeeded = 32;
  const size_t allowed = allowDescriptors(kNeeded);
  if (allowed >= kNeeded) return;
  refuse(kExitDescriptors, "the limit on open files (RLIMIT_NOFILE) is " + std::to_string(allowed) +
                               ", and the service needs " + std::to_string(kNeeded));
}

StateDirectory& stateDirectory(const std::string& path) {
  auto opened = StateDirectory::open(path);
  if (const auto* error = std::get_if<PlatformError>(&opened))
    refuse(kExitStateDirectory, error->words);
  return keep<StateDirectory>(std::get<StateDirectory>(std::move(opened)));
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
                const std::string& stateDirectory) {
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
    record.marker = LocalFiles().existence(cookieFilePath).exists ? "still there" : "removed";
    record.interval = launch.activityInterval;
    logFindings(record);
  }
  if (const auto failure = writeRunRecord(record, stateDirectory)) {
    platformLog().warning("The record of the run is not written: %@", failure->words);
  }
}

RunBook bookOfRuns(const LaunchConfiguration& launch, const StateDirectory& state, Spool& spool,
                   SerialQueue& reportingQueue) {
  const std::string taskingFile = launch.configurationDirectory + "/" + kTaskingType + ".json";
  return {[&state, taskingFile](Date begun) {
            // If this fails, the end of the run most likely cannot be written either, and that is a
            // warning.
            writeRunBegin(begun, taskingFile, state.path());
          },
          [launch, &state, &spool, &reportingQueue](const RunRecord& record) {
            // Only this queue may use the spool; all sends run there, too.
            reportingQueue.sync([&] { keepRecord(record, spool, launch, state.path()); });
          }};
}

// Makes the parts that take an object from the store to the spool.
TraceReading& makeReading(const LaunchConfiguration& launch, BuildVariant& variant, Spool& spool,
                          QueueFactory& queues, SerialQueue& reportingQueue, Clock& clock,
                          Threads& threads, ServiceStatus& status) {
  auto& throttle = keep<Throttle>(clock, threads);
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

ReportingRun& makeRun(const LaunchConfiguration& launch, const StateDirectory& state, Clock& clock,
                      Threads& threads, ServiceStatus& status, SerialQueue& reportingQueue) {
  auto& queues = keep<WorkerQueueFactory>(threads);
  auto& variant = keep<OsReleaseBuildVariant>(launch.osReleasePath);
  auto& configurations = keep<FileConfigurationService>(launch.configurationDirectory, threads);
  auto& gate = keep<TaskingGate>(variant, configurations, queues, threads);
  const auto writerQueue =
      std::make_shared<WorkerQueue>("tessel_reporter spool writer queue", threads);
  const SpoolLimits limits{launch.spoolLimitBytes, launch.spoolDays};
  auto& spool = keep<Spool>(state.path(), limits, clock, status, writerQueue, queues);
  auto& reading =
      makeReading(launch, variant, spool, queues, reportingQueue, clock, threads, status);
  return keep<ReportingRun>(gate, keep<CookieFile>(keep<LocalFiles>()), reading, clock, status,
                            bookOfRuns(launch, state, spool, reportingQueue));
}

[[noreturn]] void serve() {
  const LaunchConfiguration launch = launchConfiguration();
  requireDescriptors();
  StateDirectory& state = stateDirectory(launch.stateDirectory);
  setLogSink(makeLogSink(launch.logDestination).release(), launch.logLevel);
  for (const PlatformError& refused : state.refusedFiles())
    platformLog().warning("A file in the state directory is not used: %@", refused.words);

  auto& clock = keep<SystemClock>();
  auto& threads = keep<StandardThreads>();
  ServiceManager& manager = *connectServiceManager(clock).release();
  auto& runtime = keep<ServiceRuntime>(manager, threads);
  const auto processingQueue =
      std::make_shared<WorkerQueue>("tessel_reporter processing queue", threads);
  auto& reportingQueue = keep<WorkerQueue>("tessel_reporter Statora reporting queue", threads);
  const auto interruptSource = runtime.makeSignalSource(SIGINT, processingQueue);
  // SIGINT ends the process at once, even in the middle of a run. That run leaves its marker, so
  // the next run bails out.
  interruptSource->setHandler([] { std::exit(0); });

  auto& activity = keep<ReporterActivity>(
      runtime, makeRun(launch, state, clock, threads, manager, reportingQueue));
  auto& conditions = keep<DeferralConditions>(launch.deferOn, state.deferFile());
  auto& scheduler =
      keep<BackgroundScheduler>(ScheduleCriteria{launch.activityInterval, launch.deferRetry,
                                                 launch.runLimit, launch.deferLimit},
                                state, conditions, runtime, manager, clock, threads);
  scheduler.registerActivity(kActivityName, [&activity](const std::shared_ptr<Activity>& changed) {
    activity.handleActivity(changed);
  });
  // This comes last, so that no signal is handled before every part is made.
  interruptSource->resume();
  runtime.runMainLoop();
}

}  // namespace
}  // namespace tessel

int main() {
  tessel::prepareProcess();
  tessel::serve();
}
