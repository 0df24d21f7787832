// The figures of a dry run as JSON and as tables.

#include "tesselctl/showing/SummaryOutput.h"

#include <algorithm>
#include <nlohmann/json.hpp>

#include "linux/ReadingDigest.h"
#include "platform/Text.h"
#include "tesselctl/showing/Losses.h"

namespace tessel::ctl {

namespace {

constexpr size_t kShownPairs = 20;
constexpr size_t kShownMisses = 20;
constexpr size_t kQuotedWidth = 40;  // columns of a value in a sentence

std::string share(uint64_t part, uint64_t whole) {
  if (whole == 0 || part == 0) return "";
  const uint64_t permille = (part * 1000 + whole / 2) / whole;
  return std::to_string(permille / 10) + "." + std::to_string(permille % 10) + " %";
}

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
  json.member("whitelist_misses_not_listed", tally.missesNotListed());
}

void writeFiles(JsonWriter& json, const StoreReport& store) {
  json.array("files", store.files, [&](const FileReport& file) {
    json.object([&] {
      json.member("path", file.path).member("entries_read", file.entriesRead);
      json.member("skipped", file.skipped);
      json.array("problems", file.problems, [&](const FileProblem& problem) {
        json.object([&] {
          json.member("reason", problem.reason).member("count", problem.count);
          json.member("first_place", problem.firstPlace);
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
    if (count == 0 && verdict == TesselReporterClassificationClassNotSupported) continue;
    table.add(
        {{std::string(verdictName(verdict)), count == 0 ? Colour::faint : verdictColour(verdict)},
         grouped(count),
         share(count, tally.traceObjects()),
         std::string(classificationRow(verdict).title)});
  }
  return table.render(terminal, 2);
}

std::string kindTable(const Tally& tally, const Terminal& terminal) {
  Table table({{"KIND"}, {"REPORTED", Table::Align::right}, {"NOT REPORTED", Table::Align::right}});
  for (size_t kind = 0; kind < Tally::kKinds.size(); ++kind) {
    const KindCounts& counts = tally.kinds()[kind];
    table.add(
        {std::string(Tally::kKinds[kind]), grouped(counts.reported), grouped(counts.unreported)});
  }
  return table.render(terminal, 2);
}

std::string more(size_t listed, size_t all, std::string_view what) {
  if (all <= listed) return {};
  return "  ... and " + grouped(all - listed) + " more " + std::string(what) +
         " (--json lists all)\n";
}

struct PairColumn {
  const char* title;
  std::vector<TesselReporterClassification> verdicts;

  uint64_t count(const VerdictCounts& counts) const {
    uint64_t sum = 0;
    for (const auto verdict : verdicts) sum += counts[verdict];
    return sum;
  }
};

// The columns that are not zero throughout; what is reported is always shown. Verdicts that have no
// column of their own share the last one, so the columns of a row sum up to its objects.
std::vector<PairColumn> pairColumns(const VerdictCounts& all) {
  std::vector<PairColumn> columns = {
      {"REPORTED", {TesselReporterClassificationTelemetryReported}},
      {"DISABLED", {TesselReporterClassificationTelemetryDisabled}},
      {"UNKNOWN", {TesselReporterClassificationFailedStringWhitelist}},
      {"THINNED", {TesselReporterClassificationFailedSCFilter}}};
  PairColumn other{"OTHER", {}};
  for (const auto verdict : kVerdictOrder) {
    const auto shows = [&](const PairColumn& column) { return column.verdicts[0] == verdict; };
    if (std::ranges::none_of(columns, shows)) other.verdicts.push_back(verdict);
  }
  columns.push_back(std::move(other));
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
  for (const PairColumn& column : counted) columns.push_back({column.title, Table::Align::right});
  Table table(std::move(columns));
  const auto pairs = tally.pairs();
  for (size_t at = 0; at < std::min(pairs.size(), kShownPairs); ++at) {
    std::vector<Table::Cell> row = {terminalText(pairs[at].subsystem),
                                    terminalText(pairs[at].category)};
    for (const PairColumn& column : counted)
      row.emplace_back(grouped(column.count(pairs[at].counts)));
    table.add(std::move(row));
  }
  return table.render(terminal, 2) + more(kShownPairs, pairs.size(), "pairs");
}

std::string missTable(const Tally& tally, const Terminal& terminal) {
  Table table({{"TIMES", Table::Align::right},
               {"VALUE", Table::Align::left, true},
               {"STRING"},
               {"TRACE POINT", Table::Align::left, true}});
  const auto misses = tally.misses();
  for (size_t at = 0; at < std::min(misses.size(), kShownMisses); ++at) {
    const Tally::Miss& miss = misses[at];
    table.add({grouped(miss.count), "\"" + terminalText(miss.value) + "\"",
               std::to_string(miss.slot),
               terminalText(miss.subsystem) + " / " + terminalText(miss.category) + " / " +
                   terminalText(miss.name)});
  }
  std::string out = table.render(terminal, 2) + more(kShownMisses, misses.size(), "values");
  if (tally.missesNotListed() != 0) {
    out += "  " + counted(tally.missesNotListed(), "object", "objects") + " had further values\n";
  }
  return out;
}

void addLosses(Table& table, const std::vector<Loss>& losses) {
  for (const Loss& loss : losses) table.add({grouped(loss.count), terminalText(loss.what)});
}

std::string lossLines(const ExtractionReport& report, const Terminal& terminal) {
  const AssemblyCounts& counts = report.assembly;
  Table table({{"ENTRIES", Table::Align::right}, {"WHY NO TRACE OBJECT CAME OF THEM"}});
  addLosses(table, entryLosses(malformedCounts(report), counts.droppedOpenIntervals,
                               report.beyondPairLimit));
  addLosses(table, thoseThatOccurred({
                       {counts.unmatchedEnds, "an end whose begin was not read"},
                       {counts.replacedBegins, "a begin that was replaced by a second one"},
                       {counts.openIntervals, "a begin that waits for its end"},
                   }));
  return table.empty() ? "" : "\n" + table.render(terminal, 2);
}

// What the store itself has lost or never had; empty where nothing is missing.
std::string storeLines(const ExtractionReport& report, const Terminal& terminal) {
  const std::string part = partOfPeriod(report.store);
  Table table(
      {{"NUMBER", Table::Align::right}, {"WHAT THE STORE LACKS", Table::Align::left, true}});
  addLosses(table, storeLosses(report.store, report.assembly.withoutImagePath));
  return (part.empty() ? "" : "\n" + part + ".\n") +
         (table.empty() ? "" : "\n" + table.render(terminal, 2));
}

std::string fileLines(const StoreReport& store, const Terminal& terminal) {
  Table table({{"PROBLEM", Table::Align::left, true},
               {"TIMES", Table::Align::right},
               {"FILE", Table::Align::left, true}});
  for (const FileReport& file : store.files) {
    if (file.skipped && !file.outsideRange)
      table.add({terminalText(whyNotRead(file)), "", terminalText(file.path)});
    for (const FileProblem& problem : file.problems) {
      table.add({terminalText(problem.reason), grouped(problem.count), terminalText(file.path)});
    }
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

std::string summaryJson(const Tally& tally, const ExtractionReport& report) {
  return objectLine([&](JsonWriter& json) {
    json.member("log_events", report.entriesRead).member("trace_objects", tally.traceObjects());
    json.object("verdicts", [&] { addVerdicts(json, tally.verdicts()); });
    writeKinds(json, tally);
    writePairs(json, tally);
    json.object("malformed", [&] {
      for (const auto& [reason, count] : malformedCounts(report)) json.member(reason, count);
    });
    writeMisses(json, tally);
    writeIntervals(json, report.assembly);
    json.member("beyond_pair_limit", report.beyondPairLimit);
    json.member("without_exe", report.assembly.withoutImagePath);
    json.rawMember("store", jsonLine(storeJson(report.store)));
    writeFiles(json, report.store);
    json.member("start", tally.period().start).member("end", tally.period().end);
  });
}

std::string summaryText(const Tally& tally, const ExtractionReport& report,
                        const Terminal& terminal) {
  std::string out = dateText(tally.period().start) + " to " + dateText(tally.period().end) + "\n" +
                    counted(report.entriesRead, "log event", "log events") + ", " +
                    counted(tally.traceObjects(), "trace object", "trace objects") + "\n\n" +
                    verdictTable(tally, terminal);
  if (tally.traceObjects() != 0)
    out += "\n" + kindTable(tally, terminal) + "\n" + pairTable(tally, terminal);
  if (tally.verdicts()[TesselReporterClassificationFailedStringWhitelist] != 0) {
    out += "\n" + terminal.paint(Colour::strong, "Values that are not known ones") + "\n" +
           missTable(tally, terminal);
  }
  return out + lossLines(report, terminal) + storeLines(report, terminal) +
         fileLines(report.store, terminal);
}

}  // namespace tessel::ctl
