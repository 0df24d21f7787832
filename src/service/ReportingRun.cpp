// The steps of a run, in their order.

#include "service/ReportingRun.h"

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

RunReport endedWith(RunEnding ending) {
  RunReport report;
  report.ending = ending;
  return report;
}

}  // namespace

void ReportingRun::performReportingRun(const std::shared_ptr<Activity>& activity) {
  const Date began = surroundings_.clock.now();
  RunReport ended = attempt(activity);
  ended.began = began;
  ended.ended = surroundings_.clock.now();
  surroundings_.status.say("idle");
  runEnded_(ended);
}

RunReport ReportingRun::attempt(const std::shared_ptr<Activity>& activity) {
  surroundings_.status.say("waiting for the tasking configuration");
  if (!gate_.shouldReport()) return endedWith(RunEnding::notTasked);
  if (cookie_.cookieFileExists()) {
    tesselReporterLog().debug("Bailing due to cookie file");
    cookie_.clearCookieFile();
    return endedWith(RunEnding::bailedOut);
  }
  if (!cookie_.createCookieFile()) return endedWith(RunEnding::noMarker);
  RunReport reported = report(activity);
  cookie_.clearCookieFile();
  return reported;
}

RunReport ReportingRun::report(const std::shared_ptr<Activity>& activity) {
  RunReport report;
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
  road_.reportingQueue.sync([&] {
    report.countEvents = summary_.reportRunSummary(*filter, *extractor, startDate, endDate,
                                                   *interruptedByDeferral, startTime);
  });
  report.ending = failure ? RunEnding::extractionFailed : RunEnding::completed;
  report.failure = failure.value_or("");
  report.unnamed = reporter->unnamedCount();
  report.filter = filter;
  report.extractor = extractor;
  report.interruptedByDeferral = *interruptedByDeferral;
  return report;
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
