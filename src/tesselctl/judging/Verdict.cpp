// Names and reasons of verdicts.

#include "tesselctl/judging/Verdict.h"

#include "platform/Number.h"
#include "tesselctl/showing/JsonLine.h"
#include "tesselctl/showing/ShownText.h"

namespace tessel::ctl {

namespace {

constexpr size_t kQuotedWidth = 40;  // columns of a value in a sentence

struct Description {
  std::string_view name;
  std::string_view meaning;
  Colour colour;
};

// By classification code.
constexpr Description kDescriptions[kVerdicts] = {
    {"telemetry_disabled", "not marked for telemetry", Colour::faint},
    {"reported", "reported", Colour::good},
    {"string_whitelist", "a text value is not a known one", Colour::bad},
    {"duration", "its duration is negative", Colour::caution},
    {"downsampled", "held back by downsampling", Colour::caution},
    {"class_not_supported", "its kind cannot be reported", Colour::caution},
};

std::string quoted(StringRef text) {
  if (!text) return "none";
  return "\"" + shortened(terminalText(text.text()), kQuotedWidth) + "\"";
}

std::string whitelistWords(const FilterDecision& decision) {
  const std::string slot = "string " + std::to_string(decision.stringSlot);
  const std::string label = decision.stringLabel ? " " + quoted(decision.stringLabel) : "";
  if (!decision.stringValue) return slot + label + " has no value";
  return slot + label + " has the value " + quoted(decision.stringValue) +
         (decision.specialRule ? ", which the rule for performance logging does not know"
                               : ", which is not a known value");
}

std::string downsamplingWords(const TRDownsampleEntry& entry, const std::string& scope) {
  std::string words = shortened(terminalText(scope), kQuotedWidth);
  if (entry.cap() == 0) return words + " is never reported";
  words += ": one in " + grouped(entry.downsampleRatio()) + ", at most " + grouped(entry.cap()) +
           "; this is number " + grouped(entry.eventsSeen()) + ", " +
           grouped(entry.eventsReported()) + " reported so far";
  return words;
}

}  // namespace

std::string_view verdictName(TesselReporterClassification classification) {
  return kDescriptions[classification].name;
}

std::optional<TesselReporterClassification> verdictNamed(std::string_view name) {
  for (const TesselReporterClassification known : kVerdictOrder) {
    if (verdictName(known) == name) return known;
  }
  return {};
}

std::string_view verdictMeaning(TesselReporterClassification classification) {
  return kDescriptions[classification].meaning;
}

Colour verdictColour(TesselReporterClassification classification) {
  return kDescriptions[classification].colour;
}

std::string downsamplingScope(const TesselReporterObjectFilter& filter, const TesselObject& object,
                              const TRDownsampleEntry* entry) {
  if (entry == nullptr || filter.scnFilter() == nullptr) return {};
  const FilterQuery query(object.subsystem(), object.category(), object.name());
  std::string scope;
  for (const FilterTier* tier = &filter.scnFilter()->filterTreeRoot();
       tier->downsampleEntry() != entry;) {
    const StringRef key = tier->keyForChildren(query);
    if (!key || tier->childTiers() == nullptr) return {};
    const auto child = tier->childTiers()->find(key);
    if (child == tier->childTiers()->end()) return {};
    scope.append(scope.empty() ? "" : "/").append(key.text());
    tier = child->second.get();
  }
  return scope;
}

std::string ruleJson(const FilterDecision& decision, const std::string& scope) {
  std::string out;
  JsonObject rule(out);
  if (decision.classification == TesselReporterClassificationFailedStringWhitelist) {
    rule.count("slot", decision.stringSlot)
        .text("label", decision.stringLabel)
        .text("value", decision.stringValue);
    if (decision.specialRule) rule.boolean("special", true);
  } else if (decision.classification == TesselReporterClassificationDurationThreshold) {
    rule.number("duration", Number{decision.durationSeconds});
  } else if (decision.downsampleEntry != nullptr) {
    rule.text("scope", std::string_view(scope))
        .count("cap", decision.downsampleEntry->cap())
        .count("ratio", decision.downsampleEntry->downsampleRatio())
        .count("seen", decision.downsampleEntry->eventsSeen())
        .count("reported", decision.downsampleEntry->eventsReported());
  } else {
    return {};
  }
  rule.end();
  return out;
}

std::string ruleWords(const FilterDecision& decision, const std::string& scope) {
  switch (decision.classification) {
    case TesselReporterClassificationFailedStringWhitelist:
      return whitelistWords(decision);
    case TesselReporterClassificationDurationThreshold:
      return "its duration is " + numberText(Number{decision.durationSeconds}) + " s";
    default:
      return decision.downsampleEntry == nullptr
                 ? ""
                 : downsamplingWords(*decision.downsampleEntry, scope);
  }
}

}  // namespace tessel::ctl
