// The steps of a run, in their order.

#include "service/ReportingRun.h"

#include "platform/Invariant.h"
#include "platform/Log.h"
#include "service/BootVolume.h"

namespace tessel {

namespace {

constexpr std::chrono::seconds kLookBack{86400};
constexpr std::chrono::nanoseconds kPollInterval{10'000'000'000};
constexpr std::chrono::nanoseconds kPollLeeway{10'000'000'000};

void pollDeferral(Activity& activity, std::atomic<bool>& interruptedByDeferral,
                  const std::weak_ptr<TesselSupportObjectExtractor>& extractor) {
  if (!activity.shouldDefer()) {
    tesselReporterLog().debug("Deferral not requested, continuing.");
    return;
  }
  tesselReporterLog().debug("Trying to stop in-flight reporting work.");
  if (const auto running = extractor.lock()) running->stopProcessing();
  interruptedByDeferral = true;
  tesselReporterLog().debug("Concluding processing due to deferral request");
}

RunRecord endedWith(RunOutcome outcome, std::string failure = {}) {
  RunRecord record;
  record.outcome = outcome;
  record.failure = std::move(failure);
  return record;
}

void addObjects(RunRecord& record, const TesselReporterObjectFilter& filter) {
  record.inspected = filter.allInspectedTesselObjectsAggregation().totalCount();
  record.classified = filter.classifiedCounts();
  // Each object that was inspected was reported or held back for exactly one reason.
  TESSEL_INVARIANT(record.objectsBalance());
}

}  // namespace

void ReportingRun::performReportingRun(const std::shared_ptr<Activity>& activity) {
  const Date began = surroundings_.clock.now();
  RunRecord record = attempt(activity);
  record.start = began;
  record.end = surroundings_.clock.now();
  surroundings_.status.say("idle");
  runEnded_(record);
}

RunRecord ReportingRun::attempt(const std::shared_ptr<Activity>& activity) {
  surroundings_.status.say("waiting for the tasking configuration");
  if (!gate_.shouldReport()) return endedWith(RunOutcome::notTasked);
  if (cookie_.cookieFileExists()) {
    tesselReporterLog().debug("Bailing due to cookie file");
    cookie_.clearCookieFile();
    return endedWith(RunOutcome::bailedOut);
  }
  if (!cookie_.createCookieFile())
    return endedWith(RunOutcome::failed, "the run marker could not be made");
  RunRecord reported = report(activity);
  cookie_.clearCookieFile();
  return reported;
}

RunRecord ReportingRun::report(const std::shared_ptr<Activity>& activity) {
  Clock& clock = surroundings_.clock;
  const uint64_t startTime = clock.continuousTicks();
  const auto extractor = makeExtractor_();
  const auto filter = TesselReporterObjectFilter::init(surroundings_.buildVariant);
  const auto reporter = makeObjectReporter(filter);
  installCallbacks(*extractor, reporter);
  extractor->setBuildAnimationCompositeIntervalTimelines(false);
  const auto interruptedByDeferral = std::make_shared<std::atomic<bool>>(false);
  const Date startDate = clock.now() - kLookBack;
  const Date endDate = clock.now();
  startDeferralPoll(activity, interruptedByDeferral, extractor);
  surroundings_.status.say("reading the trace store");
  const auto failure = extract(*extractor, startDate, endDate);
  surroundings_.status.say("summarising");
  RunRecord record =
      endedWith(failure ? RunOutcome::failed : RunOutcome::completed, failure.value_or(""));
  road_.reportingQueue.sync([&] {
    record.countEvents = summary_.reportRunSummary(*filter, *extractor, startDate, endDate,
                                                   *interruptedByDeferral, startTime);
  });
  // A deferral may come as late as during the summary; it is asked for last.
  if (!failure && *interruptedByDeferral) record.outcome = RunOutcome::interrupted;
  record.logEvents = extractor->processedEventCount();
  record.reading = extractor->reading();
  record.unnamed = reporter->unnamedCount();
  addObjects(record, *filter);
  return record;
}

std::shared_ptr<ObjectReporter> ReportingRun::makeObjectReporter(
    const std::shared_ptr<TesselReporterObjectFilter>& filter) {
  SharedString filesystem = bootFilesystemType(surroundings_.volumes);
  const SharedString disk(bootDiskType);
  auto reporter = std::make_shared<ObjectReporter>(road_, filter, std::move(filesystem), disk);
  tesselReporterLog().debug("Boot disk type: %@", disk);
  return reporter;
}

void ReportingRun::installCallbacks(TesselSupportObjectExtractor& extractor,
                                    const std::shared_ptr<ObjectReporter>& reporter) {
  const auto reportTesselObject = [reporter, &status = surroundings_.status](
                                      const std::shared_ptr<const TesselObject>& object) {
    status.progress();
    return reporter->reportTesselObject(object);
  };
  extractor.setIntervalCompletionProcessingBlock(reportTesselObject);
  extractor.setAnimationIntervalCompletionProcessingBlock(reportTesselObject);
  extractor.setEmitEventProcessingBlock(reportTesselObject);
}

void ReportingRun::startDeferralPoll(
    const std::shared_ptr<Activity>& activity, const InterruptedCell& interruptedByDeferral,
    const std::shared_ptr<TesselSupportObjectExtractor>& extractor) {
  const auto queue = surroundings_.queues.makeSerialQueue("tessel_reporter defer polling queue");
  const std::weak_ptr<TesselSupportObjectExtractor> weakExtractor = extractor;
  surroundings_.queues
      .makeRepeatingTimer(queue, kPollInterval, kPollLeeway,
                          [activity, interruptedByDeferral, weakExtractor] {
                            pollDeferral(*activity, *interruptedByDeferral, weakExtractor);
                          })
      ->resume();
}

std::optional<std::string> ReportingRun::extract(TesselSupportObjectExtractor& extractor,
                                                 Date startDate, Date endDate) {
  std::optional<PlatformError> error;
  if (extractor.processLogArchiveWithPath(std::nullopt, startDate, endDate, error)) return {};
  std::string description = error ? error->words : "Unknown error";
  tesselReporterLog().debug("Failed to process tessel data due to error: %@", description);
  return description;
}

}  // namespace tessel
