// The findings of a dry run, as JSON and as text for people: single verdicts with their reasons,
// and the summary.
//
// Stateless; any thread.

#pragma once

#include <string>
#include <string_view>

#include "platform/Json.h"
#include "tesselctl/judging/Tally.h"
#include "tesselctl/showing/Terminal.h"
#include "trace/JournalExtractor.h"

namespace tessel::ctl {

Colour verdictColour(TesselReporterClassification classification);

// One member for each verdict: its name and its count.
void addVerdicts(JsonWriter& json, const VerdictCounts& counts);

// Writes the reason of a verdict as the member "rule". Writes nothing if the verdict needs no
// reason.
void addRule(JsonWriter& json, const FilterDecision& decision, const std::string& scope);
// The reason as a sentence, fit for a terminal; empty if the verdict needs none. Texts that the
// sentence quotes are shortened on a terminal only.
std::string ruleWords(const FilterDecision& decision, const std::string& scope,
                      const Terminal& terminal);

// The figures as one JSON object on one line.
std::string summaryJson(const Tally& tally, const ExtractionReport& report);
// The figures as tables.
std::string summaryText(const Tally& tally, const ExtractionReport& report,
                        const Terminal& terminal);

}  // namespace tessel::ctl
