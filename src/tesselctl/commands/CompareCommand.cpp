// compare: what a second setting would report that the first does not, and the other way round; and
// what became slower from one period to the next.

#include <algorithm>
#include <set>

#include "platform/Text.h"
#include "tesselctl/commands/Comparison.h"
#include "tesselctl/showing/DurationOutput.h"
#include "tesselctl/showing/Losses.h"
#include "tesselctl/showing/SummaryOutput.h"

namespace tessel::ctl {

namespace {

struct CompareOptions {
  ReadingOptions reading;
  std::string settings[2];
  bool json = false;
};

// Reads "Quarro,internal,last=24h". A setting takes from `usual` all that it does not name. If a
// word makes no sense, prints it on stderr and returns nothing.
std::optional<Setting> settingOf(const std::string& words, const Reading& usual, Date now) {
  Setting setting{usual.machine, usual.period};
  PeriodArguments period;
  std::set<std::string> given;  // what was set, so that a second word for it is a mistake
  for (size_t begin = 0; begin <= words.size();) {
    const size_t end = std::min(words.find(',', begin), words.size());
    // A comma ends a word, and an empty word is a mistake: it is what a variable that is not set
    // leaves behind.
    const std::string word = words.substr(begin, end - begin);
    begin = end + 1;
    if (word == "usual") continue;
    // Two words for the same thing are refused and not overridden: with "internal,no-internal"
    // nobody could tell which one the figures are of.
    const auto platform = platformNamed(word);
    const std::string what = platform                     ? "platform"
                             : word.ends_with("internal") ? "internal"
                                                          : word.substr(0, word.find('='));
    if (!given.insert(what).second) {
      fail(kUsage, "setting '" + words + "': '" + word + "' contradicts a word before it");
      return {};
    }
    if (word == "internal" || word == "no-internal") {
      setting.machine.internal = word == "internal";
    } else if (platform) {
      setting.machine.platform = *platform;
    } else if (word.starts_with("since=")) {
      period.since = word.substr(6);
    } else if (word.starts_with("until=")) {
      period.until = word.substr(6);
    } else if (word.starts_with("last=")) {
      period.last = word.substr(5);
    } else {
      fail(kUsage, "'" + word + "' is no setting; settings are usual, internal, no-internal, " +
                       platformNames() + ", since=DATE, until=DATE, last=DURATION");
      return {};
    }
  }
  // periodOf() would take no arguments for "the last 24 hours" and override --since of the command.
  if (!period.given()) return setting;
  const PeriodResult result = periodOf(period, now);
  if (!result.period) {
    fail(kUsage, "setting '" + words + "': " + result.error);
    return {};
  }
  setting.period = *result.period;
  return setting;
}

// The slot and the value stand only beside the whitelist. For any other rule a slot of 0 would look
// like a string that failed.
void writeChange(JsonWriter& json, const Change& change, uint64_t count) {
  json.object([&] {
    json.member("change", change.starts ? "start" : "stop");
    json.member("subsystem", change.subsystem).member("category", change.category);
    json.member("name", change.name).member("count", count).member("rule", change.why);
    if (change.slot != 0) json.member("slot", change.slot).member("value", change.value);
  });
}

void writePeriods(JsonWriter& json, const Comparison& comparison) {
  // Over one period both sides hold the same objects, so durations would be the same twice.
  const auto& a = comparison.periods[0];
  const auto& b = comparison.periods[1];
  if (!a || !b) return;
  addDurationChanges(json, a->durations, b->durations);
  json.object("periods", [&] {
    for (const auto& [name, period] : {std::pair{"a", &*a}, std::pair{"b", &*b}}) {
      json.object(name, [&, &reading = period->reading] {
        json.member("start", reading.rangeStart).member("end", reading.rangeEnd);
        json.member("reaches_start", reading.reachesRangeStart());
      });
    }
  });
}

// The counts of all changes stand beside the list of them, which has a bound. A script can tell
// from the difference that the list is not whole.
std::string comparisonJson(const Comparison& comparison) {
  return objectLine([&](JsonWriter& json) {
    json.object("a", [&] { addVerdicts(json, comparison.sides[0]); });
    json.object("b", [&] { addVerdicts(json, comparison.sides[1]); });
    json.member("starts", comparison.changes.starting());
    json.member("stops", comparison.changes.stopping());
    json.array("changes", comparison.changes.listed(),
               [&](const auto& counted) { writeChange(json, counted.first, counted.second); });
    json.member("changes_not_listed", comparison.changes.notListed());
    json.member("objects_not_compared", comparison.notCompared);
    writePeriods(json, comparison);
    addLosses(json, comparison.losses);
  });
}

std::string periodsText(const Comparison& comparison, const Terminal& terminal) {
  const auto& [a, b] = comparison.periods;
  if (!a || !b) return "";
  std::string out = durationChangesText(a->durations, b->durations, terminal);
  // Without this, a store that is younger than a period looks like a machine that did nothing then.
  for (const auto& [name, period] : {std::pair{"A: ", &*a}, std::pair{"B: ", &*b}}) {
    if (const std::string part = partOfPeriod(period->reading); !part.empty())
      out += "\n" + wrapped(name + part, terminal.width, 2) + ".\n";
  }
  return out;
}

// The period of both, or behind each setting its own.
std::string comparisonHeading(const Setting (&settings)[2], const CompareOptions& options,
                              const Terminal& terminal) {
  const bool same = samePeriod(settings);
  std::string out = same ? periodText(settings[0].period) + "\n" : "";
  for (size_t side = 0; side < 2; ++side) {
    std::string line = (side == 0 ? "A: " : "B: ") + terminalText(options.settings[side]);
    if (!same) line += ", " + periodText(settings[side].period);
    out += wrapped(line, terminal.width, 3) + "\n";
  }
  return out;
}

// Over two periods nothing starts or stops by a setting: a trace point was reported in one of them
// and not in the other, and may just not have been recorded there.
std::string changesText(const Comparison& comparison, bool same, const Terminal& terminal) {
  const auto objects = [](uint64_t count) { return counted(count, "object", "objects"); };
  const Changes& changes = comparison.changes;
  const std::string starting = objects(changes.starting()), stopping = objects(changes.stopping());
  std::string out =
      wrapped(same ? "B would start to report " + starting + " and stop to report " + stopping + "."
                   : "Of trace points that only B reported: " + starting +
                         "; of those that only A reported: " + stopping + ".",
              terminal.width, 2) +
      "\n";
  Table table({{same ? "CHANGE" : "REPORTED"},
               {"OBJECTS", Table::Align::right},
               {"TRACE POINT", Table::Align::left, true},
               {same ? "HELD BACK BY" : "IN THE OTHER PERIOD", Table::Align::left, true}});
  for (const auto& [change, count] : changes.listed()) {
    std::string rule = change.why == kNotRecorded ? "not recorded" : change.why;
    if (change.slot != 0) rule += " \"" + terminalText(change.value) + "\"";
    const char* const words = same            ? (change.starts ? "starts" : "stops")
                              : change.starts ? "only in B"
                                              : "only in A";
    table.add({{words, change.starts ? Colour::good : Colour::caution},
               terminal.number(count),
               pathText(change.subsystem, change.category, change.name),
               rule});
  }
  if (!table.empty()) out += "\n" + table.render(terminal, 2);
  if (changes.notListed() != 0)
    out += "  " + objects(changes.notListed()) + " had further changes\n";
  if (comparison.notCompared != 0)
    out += "  " + objects(comparison.notCompared) + " of further trace points not compared\n";
  return out;
}

std::string comparisonText(const Comparison& comparison, const std::string& heading, bool same,
                           const Terminal& terminal) {
  // Also the verdicts without an object are listed. The two columns then have a row each for every
  // verdict, and each column adds up to all objects of its side.
  Table sums({{"VERDICT"}, {"A", Table::Align::right}, {"B", Table::Align::right}});
  for (const auto verdict : kVerdictOrder) {
    sums.add({std::string(verdictName(verdict)), terminal.number(comparison.sides[0][verdict]),
              terminal.number(comparison.sides[1][verdict])});
  }
  std::string out = heading + "\n" + sums.render(terminal, 2) + "\n" +
                    changesText(comparison, same, terminal) + periodsText(comparison, terminal);
  return out + lossText(comparison.losses, terminal);
}

int runCompare(const CompareOptions& options, const Surroundings& surroundings) {
  checkZone();
  const auto reading = readingOf(options.reading, surroundings);
  if (!reading) return kUsage;
  const auto a = settingOf(options.settings[0], *reading, surroundings.now);
  // The second setting is not looked at if the first makes no sense: one mistake, one line on
  // stderr.
  const auto b = a ? settingOf(options.settings[1], *reading, surroundings.now) : std::nullopt;
  if (!b) return kUsage;
  const Setting settings[2] = {*a, *b};
  // We could keep the stream in memory or on the disk, but it may have gigabytes. A file that the
  // user made is one that he knows of and removes.
  if (!samePeriod(settings) && reading->store == kStandardInput) {
    return fail(kUsage,
                "--store: '-' can be read once, and each of two periods needs a reading: keep the "
                "entries in a file, with journalctl -o export > FILE.export");
  }
  const Comparison comparison = compared(settings, reading->store);
  if (comparison.error) return failToRead(*comparison.error, reading->store);
  print(options.json ? comparisonJson(comparison)
                     : comparisonText(comparison,
                                      comparisonHeading(settings, options, surroundings.terminal),
                                      samePeriod(settings), surroundings.terminal));
  flushOutput();
  return warnOfUnreadFiles(comparison.unread, reading->store);
}

CommandText compareText() {
  return {
      "compare", "Say what starts or stops being reported, and what became slower",
      helpText("A setting is one word or several with commas between: usual (nothing changed), "
               "internal, no-internal, a platform (" +
               platformNames() +
               "), since=DATE, until=DATE, last=DURATION. Over one period each trace object is "
               "judged twice. Over two periods the trace points are compared that are reported at "
               "all, and how long each took: what became slower comes first.") +
          helpTable("Changes",
                    {{"starts", "B reports it and A does not"},
                     {"stops", "A reports it and B does not"},
                     {"slower",
                      "the median or the 95th percentile rose by 5 % or more, and by more than "
                      "chance makes likely; of a frame rate the median or the 5th fell"},
                     {"faster", "one of them fell so, and neither rose so"},
                     {"same", "neither"},
                     {"few_values", "too few values to tell: a median needs 11 in each period"},
                     {"only_a, only_b", "it was recorded in one period only"}}) +
          helpText(
              "The rule of the other side is the verdict of the setting that does not report "
              "it ('tesselctl explain --help' lists them), or not_recorded. Without a terminal "
              "a table is a line of titles and a line for each row, with tabs between.") +
          helpEnvironment({"TESSEL_TRACE_STORE", "TESSEL_OS_RELEASE", "TZ"}) +
          "Examples:\n"
          "  tesselctl compare since=-14d,until=-7d last=7d    (slower since last week)\n"
          "  tesselctl compare usual internal\n"
          "  tesselctl compare Selvin Quarro,internal --last 7d\n"
          "  tesselctl compare since=yesterday,until=today since=today"};
}

}  // namespace

void addCompareCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, compareText(), runCompare);
  std::vector<std::string> words = {"usual", "internal", "no-internal"};
  const std::vector<std::string> platforms = platformWords();
  words.insert(words.end(), platforms.begin(), platforms.end());
  for (const char* period : {"since=", "until=", "last="}) words.emplace_back(period);
  suggests(command.add_option("A", options.settings[0],
                              "Setting to start from: usual, internal, no-internal, a platform, "
                              "since=DATE, until=DATE, last=DURATION; several with commas between"),
           words)
      ->required()
      ->type_name("");
  suggests(
      command.add_option("B", options.settings[1], "Setting to compare with it, of the same words"),
      words)
      ->required()
      ->type_name("");
  addPeriodOptions(command, options.reading);
  command.add_flag("--json", options.json,
                   "One JSON object: a, b, starts, stops, changes, durations");
}

}  // namespace tessel::ctl
