// TesselReporterObjectFilter: decides for each trace object whether it is reported, says why, and
// counts it under exactly that reason.
//
// A filter serves one run: it is fed objects, and its counters are read once the run has delivered
// them all. The downsampling filter that it points to is shared by every filter of the process and
// keeps counting from run to run.
//
// Threads: one at a time. Once every (subsystem, category) pair has been seen, deciding allocates
// nothing; it never copies or hashes a text. An object that is given is borrowed for the call.

#pragma once

#include <array>
#include <cstdint>
#include <memory>

#include "filter/SubsystemCategoryFilter/TRSubsystemCategoryNameFilter.h"
#include "filter/TesselReporterAggregation.h"
#include "objects/TesselObject.h"
#include "objects/TesselReporterClassification.h"
#include "platform/System.h"
#include "whitelist/PlatformProfile.h"

namespace tessel {

// What the filter decided about one object, and what decided. Its strings are the object's; the
// entry is the downsampling filter's and shows the counters as they are when it is read, so before
// the next object those of this decision.
struct FilterDecision {
  TesselReporterClassification classification = TesselReporterClassificationTelemetryReported;
  // Failed string whitelist: the slot, 1 or 2, with its label and value (each may be absent, the
  // label under the special rule only), and whether it was the special rule that failed it.
  uint8_t stringSlot = 0;
  bool specialRule = false;
  StringRef stringLabel;
  StringRef stringValue;
  // Duration threshold: the duration in seconds.
  float durationSeconds = 0;
  // The entry that was asked, whether it let the object through or not; null where none was.
  const TRDownsampleEntry* downsampleEntry = nullptr;

  bool shouldReport() const {
    return classification == TesselReporterClassificationTelemetryReported;
  }
};

class TesselReporterObjectFilter {
 public:
  using Aggregation = TesselReporterAggregation;

  // A filter for the platform of this build, with the process-wide downsampling filter. `variant`
  // must outlive it.
  static std::shared_ptr<TesselReporterObjectFilter> init(BuildVariant& variant);
  // The same for another platform; null for TesselReporterPlatform::unknown.
  static std::shared_ptr<TesselReporterObjectFilter> initWithPlatform(
      TesselReporterPlatform platform, BuildVariant& variant);

  TesselReporterObjectFilter(const TesselReporterObjectFilter&) = delete;
  TesselReporterObjectFilter& operator=(const TesselReporterObjectFilter&) = delete;

  // Decides, counts, and says why.
  FilterDecision inspectTesselObject(const TesselSupportObject& object);
  // Decides and counts: true when the object is to be reported. The classification is written where
  // `classificationOut` is not null.
  bool shouldReportTesselObject(const TesselSupportObject& object,
                                TesselReporterClassification* classificationOut);
  // Counts an object under a classification; a code outside the enumeration counts as inspected and
  // as not reported alone. Called once per decision.
  void incrementTotalForObject(const TesselSupportObject& object,
                               TesselReporterClassification classification);

  // May be null, which lets every object through.
  const std::shared_ptr<TRSubsystemCategoryNameFilter>& scnFilter() const { return scnFilter_; }
  void setScnFilter(std::shared_ptr<TRSubsystemCategoryNameFilter> filter) {
    scnFilter_ = std::move(filter);
  }
  TesselReporterPlatform platform() const { return platform_; }

  const Aggregation& allInspectedTesselObjectsAggregation() const { return allInspected_; }
  const Aggregation& telemetryReportedEventsAggregation() const { return reportedEvents_; }
  // The objects of one classification. REQUIRES: the code is in the table of classifications.
  const Aggregation& aggregationFor(TesselReporterClassification classification) const {
    return classified_[classification];
  }
  const Aggregation& telemetryReportedAggregation() const {
    return aggregationFor(TesselReporterClassificationTelemetryReported);
  }
  const Aggregation& telemetryDisabledAggregation() const {
    return aggregationFor(TesselReporterClassificationTelemetryDisabled);
  }
  const Aggregation& telemetryNotReportedFailedStringWhitelistAggregation() const {
    return aggregationFor(TesselReporterClassificationFailedStringWhitelist);
  }
  const Aggregation& telemetryNotReportedFailedSCFilterAggregation() const {
    return aggregationFor(TesselReporterClassificationFailedSCFilter);
  }
  const Aggregation& telemetryNotReportedDurationThresholdAggregation() const {
    return aggregationFor(TesselReporterClassificationDurationThreshold);
  }
  const Aggregation& telemetryNotReportedClassNotSupportedAggregation() const {
    return aggregationFor(TesselReporterClassificationClassNotSupported);
  }
  // The total of each classification.
  ClassifiedCounts classifiedCounts() const;

  // Per kind; an animation interval counts as an animation only.
  uint64_t totalUnreportedIntervalCount() const { return intervals_.unreported; }
  uint64_t totalReportedIntervalCount() const { return intervals_.reported; }
  uint64_t totalUnreportedAnimationCount() const { return animations_.unreported; }
  uint64_t totalReportedAnimationCount() const { return animations_.reported; }
  uint64_t totalUnreportedEventCount() const { return events_.unreported; }
  uint64_t totalReportedEventCount() const { return events_.reported; }

 private:
  struct KindTotal {
    uint64_t reported = 0;
    uint64_t unreported = 0;
    void count(bool wasReported) { ++(wasReported ? reported : unreported); }
  };

  TesselReporterObjectFilter(TesselReporterPlatform platform, BuildVariant& variant);
  FilterDecision decide(const TesselSupportObject& object) const;
  bool objectPassesStringFilter(const TesselObject& object, FilterDecision& decision) const;
  bool objectPassesDownsampling(const TesselObject& object, FilterDecision& decision) const;

  const TesselReporterPlatform platform_;
  const PlatformProfile& profile_;
  BuildVariant& variant_;
  std::shared_ptr<TRSubsystemCategoryNameFilter> scnFilter_;
  Aggregation allInspected_;
  Aggregation reportedEvents_;
  std::array<Aggregation, kClassifications.size()> classified_;  // by code
  KindTotal intervals_;
  KindTotal animations_;
  KindTotal events_;
};

}  // namespace tessel
