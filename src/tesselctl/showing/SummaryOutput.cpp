// The figures of a dry run as JSON and as tables.
//
// JSON is for programs and complete: it lists what the tally lists. On a terminal tables are for
// one screen, so they cut long lists and say how much they cut.

#include "tesselctl/showing/SummaryOutput.h"

#include <algorithm>

#include "platform/Text.h"
#include "tesselctl/showing/DurationOutput.h"
#include "tesselctl/showing/Losses.h"

namespace tessel::ctl {

namespace {

// Both tables together fit on one screen of 50 lines. JSON has all rows.
constexpr size_t kShownPairs = 20;
constexpr size_t kShownMisses = 20;
constexpr size_t kQuotedWidth = 40;  // columns of a value in a sentence

// In tenths of a percent, rounded. A share of zero is left blank: many cells of "0.0 %" would hide
// the figures that matter.
std::string share(uint64_t part, uint64_t whole) {
  if (whole == 0 || part == 0) return "";
  // Integers, so that the same counts give the same text on each machine.
  const uint64_t permille = (part * 1000 + whole / 2) / whole;
  return std::to_string(permille / 10) + "." + std::to_string(permille % 10) + " %";
}

std::string quoted(StringRef text, const Terminal& terminal) {
  if (!text) return "none";
  return "\"" + shortened(terminalText(text.text()), terminal.limit(kQuotedWidth)) + "\"";
}

std::string whitelistWords(const FilterDecision& decision, const Terminal& terminal) {
  const std::string slot = "string " + std::to_string(decision.stringSlot);
  const std::string label =
      decision.stringLabel ? " " + quoted(decision.stringLabel, terminal) : "";
  // An absent value is held back too, but there is no text to quote.
  if (!decision.stringValue) return slot + label + " has no value";
  return slot + label + " has the value " + quoted(decision.stringValue, terminal) +
         (decision.specialRule ? ", which the rule for performance logging does not know"
                               : ", which is not a known value");
}

std::string downsamplingWords(const TRDownsampleEntry& entry, const std::string& scope,
                              const Terminal& terminal) {
  std::string words = shortened(terminalText(scope), terminal.limit(kQuotedWidth));
  // A cap of zero lets nothing through, whatever the ratio is. So we do not mention the ratio.
  if (entry.cap() == 0) return words + " is never reported";
  words += ": one in " + grouped(entry.downsampleRatio()) + ", at most " + grouped(entry.cap()) +
           "; this is number " + grouped(entry.eventsSeen()) + ", " +
           grouped(entry.eventsReported()) + " reported so far";
  return words;
}

// Tools that make tables want the same keys in each element of an array. So an absent subsystem is
// an empty text here, while `explain` leaves its key out.
void writePairs(JsonWriter& json, const Tally& tally) {
  json.array("pairs", tally.pairs(), [&](const Tally::Pair& pair) {
    json.object([&] {
      json.member("subsystem", pair.subsystem).member("category", pair.category);
      addVerdicts(json, pair.counts);
    });
  });
}

void writeMisses(JsonWriter& json, const Tally& tally) {
  json.array("whitelist_misses", tally.misses(), [&](const Tally::Miss& miss) {
    json.object([&] {
      json.member("subsystem", miss.subsystem).member("category", miss.category);
      json.member("name", miss.name).member("slot", miss.slot);
      json.member("value", miss.value).member("count", miss.count);
    });
  });
  // With this count a script can add up the misses to the verdict `string_whitelist`.
  json.member("whitelist_misses_not_listed", tally.missesNotListed());
}

void writeFiles(JsonWriter& json, const StoreReport& store) {
  json.array("files", store.files, [&](const FileReport& file) {
    json.object([&] {
      json.member("path", file.path).member("entries_read", file.entriesRead);
      // A file of other days is skipped as well, which is no loss. A script must read the reason
      // before it warns.
      json.member("skipped", file.skipped);
      json.array("problems", file.problems.all(), [&](const Loss& problem) {
        json.object([&] {
          json.member("reason", problem.words).member("count", problem.count);
          json.member("first_place", problem.place.offset);
        });
      });
    });
  });
}

void writeKinds(JsonWriter& json, const Tally& tally) {
  json.object("kinds", [&] {
    for (size_t kind = 0; kind < Tally::kKinds.size(); ++kind) {
      json.object(Tally::kKinds[kind], [&] {
        json.member("reported", tally.kinds()[kind].reported);
        json.member("unreported", tally.kinds()[kind].unreported);
      });
    }
  });
}

void writeIntervals(JsonWriter& json, const AssemblyCounts& counts) {
  json.object("intervals", [&] {
    json.member("unmatched_ends", counts.unmatchedEnds);
    json.member("replaced_begins", counts.replacedBegins);
    json.member("open", counts.openIntervals).member("dropped", counts.droppedOpenIntervals);
  });
}

std::string verdictTable(const Tally& tally, const Terminal& terminal) {
  Table table({{"VERDICT"},
               {"OBJECTS", Table::Align::right},
               {"", Table::Align::right},
               {"MEANING", Table::Align::left, true}});
  for (const auto verdict : kVerdictOrder) {
    const uint64_t count = tally.verdicts()[verdict];
    // No store yields such an object today. A row of zero would only raise questions.
    if (count == 0 && verdict == TesselReporterClassificationClassNotSupported) continue;
    table.add(
        {{std::string(verdictName(verdict)), count == 0 ? Colour::faint : verdictColour(verdict)},
         terminal.number(count),
         share(count, tally.traceObjects()),
         std::string(classificationRow(verdict).title)});
  }
  return table.render(terminal, 2);
}

std::string kindTable(const Tally& tally, const Terminal& terminal) {
  Table table({{"KIND"}, {"REPORTED", Table::Align::right}, {"NOT REPORTED", Table::Align::right}});
  for (size_t kind = 0; kind < Tally::kKinds.size(); ++kind) {
    const KindCounts& counts = tally.kinds()[kind];
    table.add({std::string(Tally::kKinds[kind]), terminal.number(counts.reported),
               terminal.number(counts.unreported)});
  }
  return table.render(terminal, 2);
}

// A table that is cut must say so, or its rows would be taken for all.
std::string more(size_t listed, size_t all, std::string_view what) {
  if (all == listed) return {};
  return "  ... and " + grouped(all - listed) + " more " + std::string(what) +
         " (--json lists all)\n";
}

struct PairColumn {
  std::string_view title;
  std::vector<TesselReporterClassification> verdicts;

  uint64_t count(const VerdictCounts& counts) const {
    uint64_t sum = 0;
    for (const auto verdict : verdicts) sum += counts[verdict];
    return sum;
  }
};

// Every verdict belongs to one column, so the columns of a row add up to its objects. Verdicts that
// share the column "OTHER" come last. A column of zeros is left out, except REPORTED, which is the
// figure that people look for.
std::vector<PairColumn> pairColumns(const VerdictCounts& all) {
  std::vector<PairColumn> columns;
  for (const bool shared : {false, true}) {
    for (const ClassificationRow& row : kClassifications) {
      if ((row.column == "OTHER") != shared) continue;
      if (!shared || columns.back().title != row.column) columns.push_back({row.column, {}});
      columns.back().verdicts.push_back(row.code);
    }
  }
  std::erase_if(columns, [&](const PairColumn& column) {
    return column.verdicts.front() != TesselReporterClassificationTelemetryReported &&
           column.count(all) == 0;
  });
  return columns;
}

std::string pairTable(const Tally& tally, const Terminal& terminal) {
  const auto counted = pairColumns(tally.verdicts());
  std::vector<Table::Column> columns = {{"SUBSYSTEM", Table::Align::left, true},
                                        {"CATEGORY", Table::Align::left, true}};
  for (const PairColumn& column : counted)
    columns.push_back({std::string(column.title), Table::Align::right});
  Table table(std::move(columns));
  const auto pairs = tally.pairs();
  const size_t shown = std::min(pairs.size(), terminal.limit(kShownPairs));
  for (size_t at = 0; at < shown; ++at) {
    std::vector<Table::Cell> row = {terminalText(pairs[at].subsystem),
                                    terminalText(pairs[at].category)};
    for (const PairColumn& column : counted)
      row.emplace_back(terminal.number(column.count(pairs[at].counts)));
    table.add(std::move(row));
  }
  return table.render(terminal, 2) + more(shown, pairs.size(), "pairs");
}

std::string missTable(const Tally& tally, const Terminal& terminal) {
  Table table({{"TIMES", Table::Align::right},
               {"VALUE", Table::Align::left, true},
               {"STRING"},
               {"TRACE POINT", Table::Align::left, true}});
  const auto misses = tally.misses();
  const size_t shown = std::min(misses.size(), terminal.limit(kShownMisses));
  // The value is quoted: blanks at its ends are a frequent reason why it is not a known one.
  for (size_t at = 0; at < shown; ++at) {
    const Tally::Miss& miss = misses[at];
    table.add({terminal.number(miss.count), "\"" + terminalText(miss.value) + "\"",
               std::to_string(miss.slot), pathText(miss.subsystem, miss.category, miss.name)});
  }
  std::string out = table.render(terminal, 2) + more(shown, misses.size(), "values");
  // The tally keeps a bounded number of values. JSON lacks the others as well, so the line does not
  // point to it.
  if (tally.missesNotListed() != 0) {
    out += "  " + counted(tally.missesNotListed(), "object", "objects") + " had further values\n";
  }
  return out;
}

// A begin or an end without a partner is no loss: the partner may stand in the day before or after.
// Such entries make no object, so this table explains why there are fewer objects than entries.
std::string unpairedTable(const AssemblyCounts& counts, const Terminal& terminal) {
  Table table({{"ENTRIES", Table::Align::right}, {"WHY NO TRACE OBJECT CAME OF THEM"}});
  const std::pair<uint64_t, const char*> rows[] = {
      {counts.unmatchedEnds, "an end whose begin was not read"},
      {counts.replacedBegins, "a begin that was replaced by a second one"},
      {counts.openIntervals, "a begin that waits for its end"}};
  for (const auto& [count, why] : rows) {
    if (count != 0) table.add({terminal.number(count), why});
  }
  return table.empty() ? "" : "\n" + table.render(terminal, 2);
}

}  // namespace

Colour verdictColour(TesselReporterClassification classification) {
  // By classification code.
  static constexpr Colour kColours[] = {Colour::faint,   Colour::good,    Colour::bad,
                                        Colour::caution, Colour::caution, Colour::caution};
  static_assert(std::size(kColours) == kClassifications.size(), "each verdict needs a colour");
  return kColours[classification];
}

// Each verdict has its member, also at zero: a script that adds them up needs no list of its own.
void addVerdicts(JsonWriter& json, const VerdictCounts& counts) {
  for (const auto verdict : kVerdictOrder) json.member(verdictName(verdict), counts[verdict]);
}

void addRule(JsonWriter& json, const FilterDecision& decision, const std::string& scope) {
  if (decision.classification == TesselReporterClassificationFailedStringWhitelist) {
    json.object("rule", [&] {
      json.member("slot", decision.stringSlot).member("label", decision.stringLabel);
      json.member("value", decision.stringValue);
      if (decision.specialRule) json.member("special", true);
    });
  } else if (decision.classification == TesselReporterClassificationDurationThreshold) {
    json.object("rule", [&] { json.member("duration", decision.durationSeconds); });
  } else if (const TRDownsampleEntry* entry = decision.downsampleEntry; entry != nullptr) {
    json.object("rule", [&] {
      json.member("scope", scope).member("cap", entry->cap());
      json.member("ratio", entry->downsampleRatio()).member("seen", entry->eventsSeen());
      json.member("reported", entry->eventsReported());
    });
  }
}

std::string ruleWords(const FilterDecision& decision, const std::string& scope,
                      const Terminal& terminal) {
  switch (decision.classification) {
    case TesselReporterClassificationFailedStringWhitelist:
      return whitelistWords(decision, terminal);
    case TesselReporterClassificationTelemetryDisabled:
      return "it is not marked for telemetry (TESSEL_TELEMETRY=1)";
    case TesselReporterClassificationClassNotSupported:
      return "its kind cannot be reported";
    case TesselReporterClassificationDurationThreshold:
      return "its duration is " + numberText(Number{decision.durationSeconds}) + " s";
    default:
      return decision.downsampleEntry == nullptr
                 ? ""
                 : downsamplingWords(*decision.downsampleEntry, scope, terminal);
  }
}

std::string summaryJson(const Tally& tally, const ExtractionReport& report) {
  const StoreReading& reading = report.store.reading;
  return objectLine([&](JsonWriter& json) {
    json.member("log_events", report.entriesRead).member("trace_objects", tally.traceObjects());
    json.object("verdicts", [&] { addVerdicts(json, tally.verdicts()); });
    writeKinds(json, tally);
    writePairs(json, tally);
    addDurations(json, tally.durations());
    addMalformed(json, reading.losses);
    writeMisses(json, tally);
    writeIntervals(json, report.assembly);
    addStore(json, reading);
    addOverShare(json, reading.losses);
    writeFiles(json, report.store);
    json.member("start", tally.period().start).member("end", tally.period().end);
    addLosses(json, reading.losses);
  });
}

std::string summaryText(const Tally& tally, const ExtractionReport& report,
                        const Terminal& terminal) {
  std::string out = periodText(tally.period()) + "\n" +
                    counted(report.entriesRead, "log event", "log events") + ", " +
                    counted(tally.traceObjects(), "trace object", "trace objects") + "\n\n" +
                    verdictTable(tally, terminal);
  if (tally.traceObjects() != 0)
    out += "\n" + kindTable(tally, terminal) + "\n" + pairTable(tally, terminal);
  out += durationText(tally.durations(), terminal);
  // The verdict decides and not the list: the list may be full while objects were held back.
  if (tally.verdicts()[TesselReporterClassificationFailedStringWhitelist] != 0) {
    out += "\n" + terminal.paint(Colour::strong, "Values that are not known ones") + "\n" +
           missTable(tally, terminal);
  }
  // What made no object comes behind what did, and losses come last, where they are seen.
  out += unpairedTable(report.assembly, terminal);
  const StoreReading& reading = report.store.reading;
  for (const std::string& note : notesOn(reading))
    out += "\n" + wrapped(terminalText(note), terminal.width, 2) + ".\n";
  out += lossText(reading.losses, terminal);
  return out;
}

}  // namespace tessel::ctl
