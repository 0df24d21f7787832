// What a dry run found, as JSON and for people: single verdicts with their reasons, and the
// summary.
//
// Stateless; any thread.

#pragma once

#include <string>
#include <string_view>

#include "tesselctl/judging/Tally.h"
#include "tesselctl/showing/JsonLine.h"
#include "tesselctl/showing/Terminal.h"
#include "trace/ExtractionReport.h"

namespace tessel::ctl {

Colour verdictColour(TesselReporterClassification classification);

// A count under the name of each verdict.
void addVerdicts(JsonObject& object, const VerdictCounts& counts);

// The reason of a verdict as a JSON object; empty where the verdict says it all.
std::string ruleJson(const FilterDecision& decision, const std::string& scope);
// The same as a sentence, fit for a terminal.
std::string ruleWords(const FilterDecision& decision, const std::string& scope);

// The figures as one JSON object on one line.
std::string summaryJson(const Tally& tally, const ExtractionReport& report);
// The figures as tables.
std::string summaryText(const Tally& tally, const ExtractionReport& report,
                        const Terminal& terminal);

}  // namespace tessel::ctl
