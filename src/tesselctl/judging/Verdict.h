// Verdicts: what the filter decided about a trace object, in names, words and JSON.
//
// Stateless; any thread.

#pragma once

#include <array>
#include <optional>
#include <string>
#include <string_view>

#include "filter/TesselReporterObjectFilter.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

inline constexpr size_t kVerdicts = 6;

// In the order in which people care: what is reported first, then the checks that hold back.
inline constexpr std::array<TesselReporterClassification, kVerdicts> kVerdictOrder = {
    TesselReporterClassificationTelemetryReported,
    TesselReporterClassificationTelemetryDisabled,
    TesselReporterClassificationFailedStringWhitelist,
    TesselReporterClassificationDurationThreshold,
    TesselReporterClassificationFailedSCFilter,
    TesselReporterClassificationClassNotSupported,
};

// "reported", "telemetry_disabled", "string_whitelist", "duration", "downsampled",
// "class_not_supported".
std::string_view verdictName(TesselReporterClassification classification);
std::optional<TesselReporterClassification> verdictNamed(std::string_view name);
// What the verdict means, for a human: "not marked for telemetry".
std::string_view verdictMeaning(TesselReporterClassification classification);
Colour verdictColour(TesselReporterClassification classification);

// The part of the downsampling table that an entry stands for: "com.vantor.TextInput" or
// "subsystem/category/name"; empty where the entry is none of the filter's.
std::string downsamplingScope(const TesselReporterObjectFilter& filter, const TesselObject& object,
                              const TRDownsampleEntry* entry);

// What decided, as a JSON object; empty where there is no more to say than the verdict.
std::string ruleJson(const FilterDecision& decision, const std::string& scope);
// What decided, as a sentence for a terminal; empty as above.
std::string ruleWords(const FilterDecision& decision, const std::string& scope);

}  // namespace tessel::ctl
