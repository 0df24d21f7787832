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

}  // namespace

void ReportingRun::performReportingRun(const std::shared_ptr<Activity>& activity) {
  observer_.runReached("waiting for tasking");
  RunReport ended;
  if (!gate_.shouldReport()) {
    ended.outcome = RunOutcome::notTasked;
  } else if (cookie_.cookieFileExists()) {
    tesselReporterLog().debug("Bailing due to cookie file");
    cookie_.clearCookieFile();
    ended.outcome = RunOutcome::bailedOut;
  } else if (!cookie_.createCookieFile()) {
    ended.outcome = RunOutcome::noMarker;
  } else {
    ended = report(activity);
    cookie_.clearCookieFile();
  }
  observer_.runEnded(ended);
}

RunReport ReportingRun::report(const std::shared_ptr<Activity>& activity) {
  Clock& clock = surroundings_.clock;
  const uint64_t startTime = clock.continuousTicks();
  const auto extractor = makeExtractor_();
  const auto filter = TesselReporterObjectFilter::init(surroundings_.buildVariant);
  installCallbacks(*extractor, makeObjectReporter(filter));
  extractor->setBuildAnimationCompositeIntervalTimelines(false);
  const auto interruptedByDeferral = std::make_shared<std::atomic<bool>>(false);
  const Date startDate = clock.now() - kLookBack;
  const Date endDate = clock.now();
  startDeferralPoll(activity, interruptedByDeferral, extractor);
  observer_.runReached("reading the trace store");
  const bool processed = extract(*extractor, startDate, endDate);
  observer_.runReached("summarising");
  road_.reportingQueue.sync([&] {
    summary_.reportRunSummary(*filter, *extractor, startDate, endDate, *interruptedByDeferral,
                              startTime);
  });
  return {processed ? RunOutcome::completed : RunOutcome::extractionFailed,
          startDate,
          endDate,
          filter,
          extractor,
          interruptedByDeferral->load()};
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
  const auto reportTesselObject =
      [reporter, &observer = observer_](const std::shared_ptr<const TesselObject>& object) {
        observer.objectDelivered();
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

bool ReportingRun::extract(TesselSupportObjectExtractor& extractor, Date startDate, Date endDate) {
  std::optional<PlatformError> error;
  if (extractor.processLogArchiveWithPath(std::nullopt, startDate, endDate, error)) return true;
  tesselReporterLog().debug("Failed to process tessel data due to error: %@",
                            error ? error->localizedDescription : std::string("Unknown error"));
  return false;
}

}  // namespace tessel
