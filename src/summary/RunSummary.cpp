// The sections, the run-summary event and the closing line.
//
// Other programs read the headings, the payload keys and the closing line. Their texts must not
// change, and neither must the line breaks in them.

#include "summary/RunSummary.h"

#include "platform/Invariant.h"
#include "platform/Log.h"

namespace tessel {

namespace {

// A run may count 4096 pairs in each of six sections, and each count event is a row in the spool.
// The limit keeps a run at 30 such rows. We send the largest counts; the log has all of them.
constexpr uint64_t kSentPerSection = 5;

struct Section {
  LogFormat<uint64_t> header;  // takes the aggregation's total
  const TesselReporterAggregation& (TesselReporterObjectFilter::*aggregation)() const;
  std::string_view classification;
};

// An object can be in several sections: a reported event is in the first three. So the totals of
// the sections do not add up to the first one.
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

Payload countPayload(const TesselReporterAggregationKey& key, uint64_t count,
                     std::string_view classification) {
  Payload payload;
  payload.set("Subsystem", key.subsystem());
  payload.set("Category", key.category());
  payload.set("Count", Number{count});
  payload.set("Classification", SharedString(classification));
  return payload;
}

// The three kinds of object make up six counts. An object of no kind is in none of them.
Payload runSummaryPayload(const TesselReporterObjectFilter& filter, uint64_t logEvents,
                          float seconds, bool interrupted) {
  Payload payload;
  payload.set("ProcessingDurationInSeconds", Number{seconds});
  payload.set("LogObjectsProcessed", Number{logEvents});
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

uint64_t CountReporter::reportCountForKey(const TesselReporterAggregationKey& key,
                                          const TesselReporterAggregation& aggregation) {
  // A key that is only logged takes a step as well. At 80 steps a second, a section of 4096 keys
  // therefore takes about 51 s, however few of its keys are sent.
  throttle_.throttleReportedEvent();
  const uint64_t count = aggregation.countForKey(key);
  if (sentCount_ == kSentPerSection) {
    tesselReporterLog().debug("%@:\t%llu (Count not reported)", key, count);
    return count;
  }
  sender_.sendEvent("com.vantor.performance.tessel_counts",
                    countPayload(key, count, classification_), EventRank::count);
  ++sentCount_;
  tesselReporterLog().debug("%@:\t%llu (Count reported to Statora)", key, count);
  return count;
}

uint64_t RunSummary::reportRunSummary(const TesselReporterObjectFilter& filter, uint64_t logEvents,
                                      Date startDate, Date endDate,
                                      const std::atomic<bool>& interruptedByDeferral,
                                      uint64_t processingStartTime) {
  const uint64_t countEvents = reportSections(filter);
  const float seconds = secondsSince(processingStartTime);
  sender_.sendEvent("com.vantor.performance.tessel_reporting_stats",
                    runSummaryPayload(filter, logEvents, seconds, interruptedByDeferral),
                    EventRank::statistics);
  const LogHandle& log = tesselReporterLog();
  // log.debug() gets its arguments ready-made. We ask first whether the line is logged, so that
  // the two dates are not formatted in vain.
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
        filter.telemetryDisabledAggregation().totalCount(), logEvents, static_cast<double>(seconds),
        dates_.format(startDate), dates_.format(endDate),
        interruptedByDeferral ? " (Interrupted by deferral)" : "");
  }
  // The throttle serves the whole process, so these totals include the runs before this one.
  if (throttle_.throttledCount() != 0) {
    log.debug("Throttled %llu times for a total of %llu usec", throttle_.throttledCount(),
              throttle_.throttledMicroseconds());
  }
  return countEvents;
}

uint64_t RunSummary::reportSections(const TesselReporterObjectFilter& filter) {
  uint64_t sent = 0;
  for (const Section& section : kSections) {
    const TesselReporterAggregation& aggregation = (filter.*section.aggregation)();
    // An empty section gets a heading, too. The log then shows that nothing was counted, and not
    // that the summary ended early.
    tesselReporterLog().debug(section.header, aggregation.totalCount());
    CountReporter counts(sender_, throttle_, section.classification);
    uint64_t counted = 0;
    for (const TesselReporterAggregationKey* key : aggregation.keysInDescendingCountOrder()) {
      // A full section takes about 51 s, all six up to five minutes. Without a sign of progress the
      // service manager would take the process for hung and kill it.
      status_.progress();
      counted += counts.reportCountForKey(*key, aggregation);
    }
    // The heading's total is the sum of the counts below it. If it is not, a key was lost or
    // counted twice.
    TESSEL_INVARIANT(counted == aggregation.totalCount());
    sent += counts.sentCount();
  }
  return sent;
}

float RunSummary::secondsSince(uint64_t startTime) {
  // The continuous clock goes on while the machine sleeps. The duration therefore includes a sleep
  // in the middle of a run.
  const uint64_t endTime = clock_.continuousTicks();
  const Timebase timebase = clock_.timebase();
  const double secondsPerTick =
      static_cast<double>(timebase.numerator) * 1e-9 / static_cast<double>(timebase.denominator);
  return static_cast<float>(static_cast<double>(endTime - startTime) * secondsPerTick);
}

}  // namespace tessel
