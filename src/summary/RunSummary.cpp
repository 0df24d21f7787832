// Sections, run-summary event, closing line.

#include "summary/RunSummary.h"

#include "platform/Log.h"
#include "summary/CountEvents.h"

namespace tessel {

namespace {

struct Section {
  LogFormat<uint64_t> header;  // takes the aggregation's total
  const TesselReporterAggregation& (TesselReporterObjectFilter::*aggregation)() const;
  std::string_view classification;
};

using Filter = TesselReporterObjectFilter;

constexpr Section kSections[] = {
    {"**************\nTotal tessel object count: %llu",
     &Filter::allInspectedTesselObjectsAggregation, "AllInspected"},
    {"**************\nReported tessel object count: %llu", &Filter::telemetryReportedAggregation,
     "Reported"},
    {"**************\nReported tessel event count: %llu",
     &Filter::telemetryReportedEventsAggregation, "ReportedEvents"},
    {"**************\nSubsystem/category filtered tessel object count: %llu",
     &Filter::telemetryNotReportedFailedSCFilterAggregation, "SubsystemCategoryFiltered"},
    {"**************\nDuration filtered tessel object count: %llu",
     &Filter::telemetryNotReportedDurationThresholdAggregation, "DurationThresholdFiltered"},
    {"**************\nString whitelist filtered tessel object count: %llu",
     &Filter::telemetryNotReportedFailedStringWhitelistAggregation, "StringWhitelistFiltered"},
};

Payload runSummaryPayload(const TesselReporterObjectFilter& filter,
                          const TesselSupportObjectExtractor& extractor, float seconds,
                          bool interrupted) {
  Payload payload;
  payload.set("ProcessingDurationInSeconds", Number{seconds});
  payload.set("LogObjectsProcessed", Number{extractor.processedEventCount()});
  payload.set("AnimationsReported", Number{filter.totalReportedAnimationCount()});
  payload.set("IntervalsReported", Number{filter.totalReportedIntervalCount()});
  payload.set("EventsReported", Number{filter.totalReportedEventCount()});
  payload.set("AnimationsNotReported", Number{filter.totalUnreportedAnimationCount()});
  payload.set("IntervalsNotReported", Number{filter.totalUnreportedIntervalCount()});
  payload.set("EventsNotReported", Number{filter.totalUnreportedEventCount()});
  payload.set("WasInterrupted", Number{interrupted});
  return payload;
}

}  // namespace

uint64_t RunSummary::reportRunSummary(const TesselReporterObjectFilter& filter,
                                      const TesselSupportObjectExtractor& extractor, Date startDate,
                                      Date endDate, const std::atomic<bool>& interruptedByDeferral,
                                      uint64_t processingStartTime) {
  const uint64_t countEvents = reportSections(filter);
  const float seconds = secondsSince(processingStartTime);
  sender_.sendEvent("com.vantor.performance.tessel_reporting_stats",
                    runSummaryPayload(filter, extractor, seconds, interruptedByDeferral));
  const LogHandle& log = tesselReporterLog();
  if (log.isEnabled(LogLevel::debug)) {
    log.debug(
        "Done processing %llu reported and %llu unreported events, %llu reported and %llu "
        "unreported intervals and "
        "%llu reported and %llu unreported animations (%llu blacklisted, %llu too short, %llu "
        "whitelisted, %llu "
        "telemetry not enabled) from %llu log events in %.2fs between %@ and %@%s\n",
        filter.totalReportedEventCount(), filter.totalUnreportedEventCount(),
        filter.totalReportedIntervalCount(), filter.totalUnreportedIntervalCount(),
        filter.totalReportedAnimationCount(), filter.totalUnreportedAnimationCount(),
        filter.telemetryNotReportedFailedSCFilterAggregation().totalCount(),
        filter.telemetryNotReportedDurationThresholdAggregation().totalCount(),
        filter.telemetryNotReportedFailedStringWhitelistAggregation().totalCount(),
        filter.telemetryDisabledAggregation().totalCount(), extractor.processedEventCount(),
        static_cast<double>(seconds), dates_.format(startDate), dates_.format(endDate),
        interruptedByDeferral ? " (Interrupted by deferral)" : "");
  }
  if (throttle_.throttledCount() != 0) {
    log.debug("Throttled %llu times for a total of %llu usec", throttle_.throttledCount(),
              throttle_.throttledMicroseconds());
  }
  return countEvents;
}

uint64_t RunSummary::reportSections(const TesselReporterObjectFilter& filter) {
  CountReporter counts(sender_, throttle_);
  for (const Section& section : kSections) {
    const TesselReporterAggregation& aggregation = (filter.*section.aggregation)();
    tesselReporterLog().debug(section.header, aggregation.totalCount());
    counts.beginSection();
    for (const TesselReporterAggregationKey* key : aggregation.keysInDescendingCountOrder()) {
      status_.progress();
      counts.reportCountForKey(*key, aggregation, section.classification);
    }
  }
  return counts.sentCount();
}

float RunSummary::secondsSince(uint64_t startTime) {
  const uint64_t endTime = clock_.continuousTicks();
  std::call_once(factorMade_, [this] {
    const Timebase timebase = clock_.timebase();
    secondsPerTick_ =
        static_cast<double>(timebase.numerator) * 1e-9 / static_cast<double>(timebase.denominator);
  });
  return static_cast<float>(static_cast<double>(endTime - startTime) * secondsPerTick_);
}

}  // namespace tessel
