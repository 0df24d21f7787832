// TesselReporterObjectFilter: decides for each trace object whether it is reported, says why, and
// counts it under exactly that reason.
//
// A filter serves one run. The run passes it every object and reads its counters after the last
// one. All filters of a platform share one downsampling filter, which goes on counting from run to
// run.
//
// Threads: one at a time. The first object of a (subsystem, category) pair may allocate; later
// objects of the pair do not. A call only borrows its object.

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

// What the filter decided about one object, and why. The strings are borrowed from the object. The
// downsampling entry is borrowed from its filter, and the next object changes its counters.
struct FilterDecision {
  TesselReporterClassification classification = TesselReporterClassificationTelemetryReported;
  // Set if the string whitelist failed the object: the slot of the string, counted from 1, and its
  // label and value. `specialRule` says that the rule for performance logging failed it. The value
  // may be absent. The label may be absent only under the special rule, which ignores labels.
  uint8_t stringSlot = 0;
  bool specialRule = false;
  StringRef stringLabel;
  StringRef stringValue;
  // Set if the duration threshold failed the object; negative then.
  float durationSeconds = 0;
  // The downsampling entry that decided, for or against the object. Null if no entry applies or an
  // earlier check failed the object.
  const TRDownsampleEntry* downsampleEntry = nullptr;

  bool shouldReport() const {
    return classification == TesselReporterClassificationTelemetryReported;
  }
};

class TesselReporterObjectFilter {
 public:
  using Aggregation = TesselReporterAggregation;

  // A filter for the platform of this build. It uses the downsampling filter that the whole process
  // shares. `variant` must outlive it.
  static std::shared_ptr<TesselReporterObjectFilter> init(BuildVariant& variant);
  // The same for another platform; null for TesselReporterPlatform::unknown.
  static std::shared_ptr<TesselReporterObjectFilter> initWithPlatform(
      TesselReporterPlatform platform, BuildVariant& variant);

  TesselReporterObjectFilter(const TesselReporterObjectFilter&) = delete;
  TesselReporterObjectFilter& operator=(const TesselReporterObjectFilter&) = delete;

  // Decides about the object and counts it. Each call counts, so call it once for each object.
  FilterDecision inspectTesselObject(const TesselSupportObject& object);
  // Also decides and counts. True if the object is to be reported. `classificationOut` may be null.
  bool shouldReportTesselObject(const TesselSupportObject& object,
                                TesselReporterClassification* classificationOut);
  // Counts an object under a classification; the two functions above call it. If the code is not in
  // the table of classifications, the object counts as inspected and as not reported, and under no
  // classification.
  void incrementTotalForObject(const TesselSupportObject& object,
                               TesselReporterClassification classification);

  // If the downsampling filter is null, nothing is downsampled.
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
  // The number of objects under each classification.
  ClassifiedCounts classifiedCounts() const;

  // Totals by kind of object. An animation interval counts as an animation and not as an interval.
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
