// The steps of a run.
//
// The order protects against a store that kills its reader. The marker is made before anything is
// read and removed after the summary. A run that dies in between leaves it for the next run to
// find.

#include "service/ReportingRun.h"

#include "platform/Invariant.h"
#include "platform/Log.h"

namespace tessel {

namespace {

constexpr char kTransactionName[] = "com.vantor.tessel.tessel_reporter_activity transaction";

// Nothing remembers which trace points earlier runs have read. If two runs are more than a day
// apart, no run reads the trace points between. If they are less than a day apart, the second run
// reports some trace points again.
constexpr std::chrono::seconds kLookBack{86400};

// The poll notices a deferral after at most 20 s: the interval and the leeway. The run then still
// sends its summary.
constexpr std::chrono::nanoseconds kPollInterval{10'000'000'000};
constexpr std::chrono::nanoseconds kPollLeeway{10'000'000'000};

void pollDeferral(Activity& activity, std::atomic<bool>& interrupted,
                  const std::weak_ptr<TesselSupportObjectExtractor>& extractor) {
  if (!activity.shouldDefer()) {
    tesselReporterLog().debug("Deferral not requested, continuing.");
    return;
  }
  tesselReporterLog().debug("Trying to stop in-flight reporting work.");
  if (const auto running = extractor.lock()) running->stopProcessing();
  interrupted = true;
  tesselReporterLog().debug("Concluding processing due to deferral request");
}

RunRecord endedWith(RunOutcome outcome, std::string failure = {}) {
  RunRecord record;
  record.outcome = outcome;
  record.failure = std::move(failure);
  return record;
}

// Returns why the extraction failed, in words; absent if it did not fail.
std::optional<std::string> extract(TesselSupportObjectExtractor& extractor, Date startDate,
                                   Date endDate) {
  std::optional<PlatformError> error;
  if (extractor.processLogArchiveWithPath(std::nullopt, startDate, endDate, error)) return {};
  std::string description = error ? error->words : "Unknown error";
  tesselReporterLog().debug("Failed to process tessel data due to error: %@", description);
  return description;
}

}  // namespace

bool CookieFile::cookieFileExists() {
  const FileExistence found = files_.existence(cookieFilePath);
  if (found.exists && found.isDirectory)
    tesselReporterLog().debug("Cookie file exists but is directory");
  return found.exists;
}

void CookieFile::clearCookieFile() {
  if (!cookieFileExists()) return;
  const RemovalResult result = files_.remove(cookieFilePath);
  if (result.removed) {
    tesselReporterLog().debug("Cleared cookie file");
  } else {
    // This is an error, because the next run will find the marker, think that this run died, and
    // read nothing.
    tesselReporterLog().error("Could not clear cookie file: %@",
                              result.error ? result.error->words : "Unknown error");
  }
}

std::optional<PlatformError> CookieFile::createCookieFile() {
  if (cookieFileExists()) return PlatformError{ErrorCode::failed, "there was a marker already"};
  if (auto error = files_.createFile(cookieFilePath)) {
    tesselReporterLog().debug("Could not create cookie file");
    return error;
  }
  tesselReporterLog().debug("Created cookie file");
  return {};
}

std::shared_ptr<const std::atomic<bool>> DeferralPoll::start(
    const std::shared_ptr<Activity>& activity,
    const std::shared_ptr<TesselSupportObjectExtractor>& extractor) {
  const auto interrupted = std::make_shared<std::atomic<bool>>(false);
  const auto queue = queues_.makeSerialQueue("tessel_reporter defer polling queue");
  // The poll outlives the run. A strong reference would keep the extractor, with the strings of a
  // whole day, in memory until the process ends.
  const std::weak_ptr<TesselSupportObjectExtractor> weakExtractor = extractor;
  queues_
      .makeRepeatingTimer(queue, kPollInterval, kPollLeeway,
                          [activity, interrupted, weakExtractor] {
                            pollDeferral(*activity, *interrupted, weakExtractor);
                          })
      ->resume();
  return interrupted;
}

RunRecord TraceReading::report(const std::shared_ptr<Activity>& activity) {
  const uint64_t startTime = clock_.continuousTicks();
  const auto extractor = makeExtractor_();
  const auto reporter = makeReporter_();
  const TesselReporterObjectFilter& filter = reporter->filter();
  installCallbacks(*extractor, reporter);
  extractor->setBuildAnimationCompositeIntervalTimelines(false);
  const Date startDate = clock_.now() - kLookBack;
  const Date endDate = clock_.now();
  const auto interrupted = poll_.start(activity, extractor);
  status_.say("reading the trace store");
  const auto failure = extract(*extractor, startDate, endDate);
  status_.say("summarising");
  RunRecord record =
      endedWith(failure ? RunOutcome::failed : RunOutcome::completed, failure.value_or(""));
  record.logEvents = extractor->processedEventCount();
  // The summary queues up behind all sends of the run, so every event that it counts has been sent
  // before it.
  reportingQueue_.sync([&] {
    record.countEvents = summary_.reportRunSummary(filter, record.logEvents, startDate, endDate,
                                                   *interrupted, startTime);
  });
  // The reading itself knows whether it came to its end. A deferral that comes later sets the flag,
  // and the closing line says so, but it cost nothing. A failure is the weightier outcome and
  // stays.
  record.reading = extractor->reading();
  const bool cutShort = record.reading ? record.reading->stopped : interrupted->load();
  if (!failure && cutShort) record.outcome = RunOutcome::interrupted;
  record.unnamed = reporter->unnamedCount();
  record.unsendable = reporter->unsendableCount();
  record.inspected = filter.allInspectedTesselObjectsAggregation().totalCount();
  record.classified = filter.classifiedCounts();
  // Each inspected object was either reported or held back, and for exactly one reason.
  TESSEL_INVARIANT(record.objectsBalance());
  return record;
}

void TraceReading::installCallbacks(TesselSupportObjectExtractor& extractor,
                                    const std::shared_ptr<ObjectReporter>& reporter) {
  const auto reportTesselObject =
      [reporter, &status = status_](const std::shared_ptr<const TesselObject>& object) {
        // The service manager kills a service that shows no progress. An object is a step even if
        // it is held back, because a long stretch of such objects is no sign of hanging.
        status.progress();
        return reporter->reportTesselObject(object);
      };
  extractor.setIntervalCompletionProcessingBlock(reportTesselObject);
  extractor.setAnimationIntervalCompletionProcessingBlock(reportTesselObject);
  extractor.setEmitEventProcessingBlock(reportTesselObject);
}

void ReportingRun::performReportingRun(const std::shared_ptr<Activity>& activity) {
  const Date began = clock_.now();
  RunRecord record = attempt(activity, began);
  record.start = began;
  record.end = clock_.now();
  // The disk may need minutes for the rows that still wait, so this is no idle process yet.
  status_.say("storing the last rows");
  book_.ended(record);
  status_.say("idle");
}

RunRecord ReportingRun::attempt(const std::shared_ptr<Activity>& activity, Date began) {
  status_.say("waiting for the tasking configuration");
  const TaskingDecision decision = gate_.decide();
  // Nobody knows whether this machine is tasked, so the run must not pass for one that was not.
  if (decision.reason == TaskingReason::notLookedAt)
    return endedWith(RunOutcome::failed, "the tasking configuration could not be looked at");
  if (!decision.on()) return endedWith(RunOutcome::notTasked);
  book_.begun(began);
  if (cookie_.cookieFileExists()) {
    // What the dead run read may have killed it, so this run reads nothing. It removes the marker,
    // so the next run reads again.
    tesselReporterLog().debug("Bailing due to cookie file");
    cookie_.clearCookieFile();
    return endedWith(RunOutcome::bailedOut);
  }
  // If this run died without a marker, nobody would notice. The next run would read the same store
  // and could die of it as well.
  if (const auto error = cookie_.createCookieFile())
    return endedWith(RunOutcome::failed, "the run marker could not be made: " + error->words);
  RunRecord record = reading_.report(activity);
  cookie_.clearCookieFile();
  return record;
}

void ReporterActivity::handleActivity(const std::shared_ptr<Activity>& changed) {
  // We hold a reference of our own, because the activity must live until the transaction is closed.
  // The order of these two lines matters: the transaction is destroyed first.
  // NOLINTNEXTLINE(performance-unnecessary-copy-initialization)
  const std::shared_ptr<Activity> activity = changed;
  const auto transaction = runtime_.openTransaction(kTransactionName);
  const int64_t state = activity->state();
  if (state == kActivityStateRun) {
    runOrDefer(activity);
  } else if (state == kActivityStateCheckIn) {
    tesselReporterLog().debug("Checking in\n");
  } else {
    tesselReporterLog().debug("Unknown state %ld\n", state);
  }
  // This only asks for the exit. The transaction is still open here, and the process does not end
  // before it is closed.
  runtime_.requestCleanExit();
}

void ReporterActivity::runOrDefer(const std::shared_ptr<Activity>& activity) {
  // If the scheduler rejects the deferral, it will not start the run later. So we run now.
  if (activity->shouldDefer() && activity->setState(kActivityStateDefer)) {
    tesselReporterLog().debug("Deferred tessel_reporter\n");
    return;
  }
  run_.performReportingRun(activity);
}

}  // namespace tessel
