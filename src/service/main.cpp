// Composition root of the service: makes every part, in order, and hands each what it needs.
//
// What is made here is never destroyed, so that the process can end at any moment, from any thread,
// while others work. Arguments are ignored; the environment is the launch configuration.

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <deque>

#include "linux/AppBundles.h"
#include "linux/LaunchConfiguration.h"
#include "linux/LogSinks.h"
#include "linux/RunRecord.h"
#include "linux/Scheduler.h"
#include "linux/ServiceRuntime.h"
#include "linux/StateDirectory.h"
#include "linux/SystemFacts.h"
#include "platform/Queues.h"
#include "service/ReporterActivity.h"
#include "statora/ConfigurationFiles.h"
#include "statora/Spool.h"
#include "trace/JournalExtractor.h"

namespace tessel {
namespace {

// Makes a T that lives as long as the process. It stays reachable, so that a leak checker does not
// take it for a leak.
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

StateDirectory& stateDirectory(const std::string& path) {
  auto opened = StateDirectory::open(path);
  if (const auto* error = std::get_if<std::string>(&opened)) refuse(kExitStateDirectory, *error);
  return keep<StateDirectory>(std::get<StateDirectory>(std::move(opened)));
}

RunOutcome outcomeOf(const RunReport& report) {
  if (report.ending == RunEnding::bailedOut) return RunOutcome::bailedOut;
  if (report.ending != RunEnding::completed) return RunOutcome::failed;
  return report.interruptedByDeferral ? RunOutcome::interrupted : RunOutcome::completed;
}

void addObjects(RunRecord& record, const TesselReporterObjectFilter& filter) {
  record.inspected = filter.allInspectedTesselObjectsAggregation().totalCount();
  record.classified = filter.classifiedCounts();
}

void addRows(RunRecord& record, const SpoolFigures& figures) {
  record.rowsStored = figures.stored;
  record.setAside = figures.setAside;
  for (size_t kind = 0; kind < kSpoolFailureKinds; ++kind) {
    record.rowsFailed.emplace_back(spoolFailureName(static_cast<SpoolFailure>(kind)),
                                   figures.failed[kind]);
  }
}

RunRecord recordOf(const RunReport& report, const SpoolFigures& figures) {
  RunRecord record;
  record.start = report.began;
  record.end = report.ended;
  record.outcome = outcomeOf(report);
  record.failure =
      report.ending == RunEnding::noMarker ? "the run marker could not be made" : report.failure;
  record.unnamed = report.unnamed;
  record.countEvents = report.countEvents;
  if (report.filter) addObjects(record, *report.filter);
  // The run's extractor is the one that makeRun() hands out.
  if (report.extractor)
    record.addReading(static_cast<const JournalExtractor&>(*report.extractor).report());
  record.marker = LocalFiles().existence(cookieFilePath).exists ? "still there" : "removed";
  addRows(record, figures);
  return record;
}

// Leaves the figures of a run for `tesselctl status`, and readies the spool for the next one.
void keepRecord(const RunReport& report, Spool& spool, const std::string& stateDirectory) {
  spool.endRun();
  if (report.ending != RunEnding::notTasked) {
    if (const auto failure = recordOf(report, spool.figures()).write(stateDirectory)) {
      tesselReporterLog().debug("Could not keep the record of the run: %@", *failure);
    }
  }
  spool.beginRun();
}

ReportingRun& makeRun(const LaunchConfiguration& launch, const StateDirectory& state,
                      SystemClock& clock, ServiceStatus& status, SerialQueue& reportingQueue) {
  auto& queues = keep<WorkerQueueFactory>();
  auto& variant = keep<OsReleaseBuildVariant>(launch.osReleasePath);
  auto& configurations = keep<FileConfigurationService>(launch.configurationDirectory);
  auto& gate = keep<TaskingGate>(variant, configurations, queues, clock);
  auto& cookie = keep<CookieFile>(keep<LocalFiles>());
  auto& spool = keep<Spool>(state.path(), clock);
  auto& throttle = keep<Throttle>(clock);
  const EventRoad road{keep<ProcessIdentity>(keep<AppBundles>()), throttle, spool, reportingQueue};
  auto& summary = keep<RunSummary>(spool, throttle, clock, keep<IcuDates>(), status);
  return keep<ReportingRun>(
      gate, cookie, RunSurroundings{status, queues, clock, keep<MountTable>(), variant},
      [store = launch.traceStore, &status] {
        // Not make_shared(), with which the weak reference of a past run's poll would hold the
        // whole extractor's memory.
        std::shared_ptr<JournalExtractor> extractor(new JournalExtractor(store));
        extractor->reportProgressTo(status);
        return extractor;
      },
      road, summary,
      [&spool, &state, &reportingQueue](const RunReport& report) {
        reportingQueue.sync([&] { keepRecord(report, spool, state.path()); });
      });
}

[[noreturn]] void serve() {
  const LaunchConfiguration launch = launchConfiguration();
  StateDirectory& state = stateDirectory(launch.stateDirectory);
  setLogSink(makeLogSink(launch.logDestination).release(), launch.logLevel);

  auto& clock = keep<SystemClock>();
  ServiceManager& manager = *connectServiceManager(clock).release();
  auto& runtime = keep<ServiceRuntime>(manager);
  const auto processingQueue = std::make_shared<WorkerQueue>("tessel_reporter processing queue");
  auto& reportingQueue = keep<WorkerQueue>("tessel_reporter Statora reporting queue");
  const auto interruptSource = runtime.makeSignalSource(SIGINT, processingQueue);
  interruptSource->setHandler([] { std::exit(0); });

  auto& activity =
      keep<ReporterActivity>(runtime, makeRun(launch, state, clock, manager, reportingQueue));
  auto& conditions = keep<DeferralConditions>(launch.deferOn, state.deferFile());
  auto& scheduler =
      keep<BackgroundScheduler>(ScheduleCriteria{launch.activityInterval, launch.deferRetry}, state,
                                conditions, runtime, manager, clock);
  scheduler.registerActivity(kActivityName, [&activity](const std::shared_ptr<Activity>& changed) {
    activity.handleActivity(changed);
  });
  interruptSource->resume();
  runtime.runMainLoop();
}

}  // namespace
}  // namespace tessel

int main() {
  tessel::prepareProcess();
  tessel::serve();
}
