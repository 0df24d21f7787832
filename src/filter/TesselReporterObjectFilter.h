// TesselReporterObjectFilter: decides for each trace object whether it is reported, says why, and
// counts it under exactly that reason.
//
// A filter serves one run. It is fed objects, and its counters are read after the run has delivered
// them all. The downsampling filter that it points to is shared by all filters of the process and
// keeps counting from run to run.
//
// Threads: one at a time. A decision about a known (subsystem, category) pair allocates nothing.
// Objects are borrowed for the call.

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

// What the filter decided about one object, and what it decided by. Strings are borrowed from the
// object. The downsampling entry is borrowed from its filter, and its counters are those of this
// decision only until the next object.
struct FilterDecision {
  TesselReporterClassification classification = TesselReporterClassificationTelemetryReported;
  // For a failed string whitelist: the slot, counted from 1, its label and its value, and whether
  // the special rule for performance logging failed it. The value may be absent, the label only
  // under the special rule.
  uint8_t stringSlot = 0;
  bool specialRule = false;
  StringRef stringLabel;
  StringRef stringValue;
  // For the duration threshold: the duration in seconds.
  float durationSeconds = 0;
  // The entry that was asked, whether it let the object through or not; null if none was asked.
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
  // The same: true if the object is to be reported. `classificationOut` may be null.
  bool shouldReportTesselObject(const TesselSupportObject& object,
                                TesselReporterClassification* classificationOut);
  // Counts an object under a classification. An object whose code is not in the table counts as
  // inspected and as not reported only. Called once per decision.
  void incrementTotalForObject(const TesselSupportObject& object,
                               TesselReporterClassification classification);

  // May be null; then nothing is downsampled.
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
