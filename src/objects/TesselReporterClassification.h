// TesselReporterClassification: why a trace object is reported or not, in code, name and words.
//
// The filter, the summary, the record of a run and tesselctl all take their classifications from
// this table. Constant data; any thread.

#pragma once

#include <algorithm>
#include <array>
#include <cstdint>
#include <string_view>

namespace tessel {

// The filter checks in the order 5, 0, 3, 2, 4; the first check that fails classifies the object.
enum TesselReporterClassification : uint64_t {
  TesselReporterClassificationTelemetryDisabled = 0,
  TesselReporterClassificationTelemetryReported = 1,
  TesselReporterClassificationFailedStringWhitelist = 2,
  TesselReporterClassificationDurationThreshold = 3,
  TesselReporterClassificationFailedSCFilter = 4,
  TesselReporterClassificationClassNotSupported = 5,
};

struct ClassificationRow {
  TesselReporterClassification code;
  std::string_view name;   // on command lines and in files
  std::string_view title;  // a few words for people, in lower case
  // The column of narrow tables that counts it. Rare ones share the last, "OTHER".
  std::string_view column;
};

// Every list for people has this order: reported objects first, then the reasons against reporting.
inline constexpr auto kClassifications = std::to_array<ClassificationRow>({
    {TesselReporterClassificationTelemetryReported, "reported", "reported", "REPORTED"},
    {TesselReporterClassificationTelemetryDisabled, "telemetry_disabled",
     "not marked for telemetry", "DISABLED"},
    {TesselReporterClassificationFailedStringWhitelist, "string_whitelist",
     "a text value is not a known one", "UNKNOWN"},
    {TesselReporterClassificationDurationThreshold, "duration", "negative duration", "OTHER"},
    {TesselReporterClassificationFailedSCFilter, "downsampled", "held back by downsampling",
     "THINNED"},
    {TesselReporterClassificationClassNotSupported, "class_not_supported",
     "kind cannot be reported", "OTHER"},
});

// Trace objects by classification code.
using ClassifiedCounts = std::array<uint64_t, kClassifications.size()>;

// REQUIRES: the code is in the table.
constexpr const ClassificationRow& classificationRow(TesselReporterClassification code) {
  return *std::ranges::find(kClassifications, code, &ClassificationRow::code);
}

// Counts are kept in arrays that a code indexes, so the codes must have neither gaps nor twins.
static_assert([] {
  for (uint64_t code = 0; code < kClassifications.size(); ++code) {
    if (std::ranges::count(kClassifications, code, &ClassificationRow::code) != 1) return false;
  }
  return true;
}());

}  // namespace tessel
