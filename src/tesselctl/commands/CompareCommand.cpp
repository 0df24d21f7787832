// compare: what a second setting would report that the first does not, and the other way round.
//
// Over one period both settings judge the same objects, so we can say for each object what changes.
// That needs one reading of the store. Over two periods the objects differ and cannot be matched.
// There we compare trace points instead: we list those that only one period reports, and how long
// each takes in both.

#include <algorithm>
#include <map>
#include <tuple>

#include "platform/Text.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/Durations.h"
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

// One side of the comparison.
struct Setting {
  JudgedMachine machine;
  Period period;
};

// Reads "Quarro,internal,last=24h". A setting takes from `usual` all that it does not name. If a
// word makes no sense, prints it on stderr and returns nothing.
std::optional<Setting> settingOf(const std::string& words, const Reading& usual, Date now) {
  Setting setting{usual.machine, usual.period};
  PeriodArguments period;
  for (size_t begin = 0; begin <= words.size();) {
    const size_t end = std::min(words.find(',', begin), words.size());
    const std::string word = words.substr(begin, end - begin);
    begin = end + 1;
    if (word == "usual") continue;
    if (word == "internal" || word == "no-internal") {
      setting.machine.internal = word == "internal";
    } else if (const auto platform = platformNamed(word)) {
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

// A trace point that one side reports and the other does not, with the reason of the other side.
struct Change {
  bool starts = false;  // reported by the second side alone
  std::string subsystem;
  std::string category;
  std::string name;
  std::string why;  // verdict of the other side; "not_recorded" if it met no such object
  // The text that the whitelist held back: its slot, 1 or 2, and its value. 0 for another reason.
  uint8_t slot = 0;
  std::string value;

  // NOLINTNEXTLINE(modernize-use-nullptr): the 0 is the compiler's own
  auto operator<=>(const Change&) const = default;
};

// Counts of distinct changes. Each object may bring a new value, so the list has the same bound as
// the list of `explain --summary`. Objects beyond it are counted together, so the listed counts and
// notListed() add up to starting() and stopping().
class Changes {
 public:
  static constexpr size_t kMost = 8192;

  void add(const Change& change, uint64_t count) {
    (change.starts ? starting_ : stopping_) += count;
    const auto known = counts_.find(change);
    if (known != counts_.end()) {
      known->second += count;
    } else if (counts_.size() < kMost) {
      counts_.emplace(change, count);
    } else {
      notListed_ += count;
    }
  }
  std::vector<std::pair<Change, uint64_t>> listed() const {
    std::vector<std::pair<Change, uint64_t>> changes(counts_.begin(), counts_.end());
    // Starts first, then most objects first. A stable sort keeps names in order among equals.
    std::stable_sort(changes.begin(), changes.end(), [](const auto& a, const auto& b) {
      return std::make_pair(!a.first.starts, b.second) < std::make_pair(!b.first.starts, a.second);
    });
    return changes;
  }
  uint64_t starting() const { return starting_; }
  uint64_t stopping() const { return stopping_; }
  uint64_t notListed() const { return notListed_; }

 private:
  std::map<Change, uint64_t> counts_;
  uint64_t starting_ = 0;
  uint64_t stopping_ = 0;
  uint64_t notListed_ = 0;
};

std::string textOf(StringRef text) { return std::string(text.textOr("")); }

// What only a comparison of two periods knows of each. Over one period both sides have the same
// objects, which take as long.
struct ComparedPeriod {
  Durations durations;
  StoreReading reading;
};

// The verdicts of both settings on a store, and the changes between them.
struct Comparison {
  VerdictCounts sides[2] = {};
  Changes changes;
  uint64_t notCompared = 0;  // objects of trace points that PointFigures has no room for
  std::optional<ComparedPeriod> periods[2];
  std::optional<PlatformError> error;
  StoreReport unread;  // the files that any reading was refused, and the most that one left out
  Losses losses;       // of each reading
};

// Two periods may read different files, so the losses of both readings are added up. A file that
// neither could read is one file all the same.
void takeReading(const DryRun& run, Comparison& comparison) {
  const StoreReport& read = run.report().store;
  comparison.losses.add(read.reading.losses);
  const auto leftOut = [](const StoreReport& report) {
    return report.reading.losses.sum(LossCode::filesNotLookedAt);
  };
  if (leftOut(read) >= leftOut(comparison.unread)) comparison.unread.reading = read.reading;
  std::vector<FileReport>& refused = comparison.unread.files;
  for (const FileReport& file : read.files) {
    const auto same = [&](const FileReport& other) { return other.path == file.path; };
    if (file.refused && std::ranges::none_of(refused, same)) refused.push_back(file);
  }
}

// One period, two judges.
void compareJudges(const Setting (&settings)[2], const Reading& reading, Comparison& comparison) {
  Judge judges[2] = {Judge(settings[0].machine), Judge(settings[1].machine)};
  DryRun run(reading.store, [&](const TesselObject& object, const EntryHeader&) {
    const FilterDecision decisions[2] = {judges[0].inspect(object), judges[1].inspect(object)};
    for (size_t side = 0; side < 2; ++side)
      ++comparison.sides[side][decisions[side].classification];
    if (decisions[0].shouldReport() == decisions[1].shouldReport()) return true;
    const bool starts = decisions[1].shouldReport();
    // Only the side that holds the object back has a reason.
    const FilterDecision& held = decisions[starts ? 0 : 1];
    comparison.changes.add(
        {starts, textOf(object.subsystem()), textOf(object.category()), textOf(object.name()),
         std::string(verdictName(held.classification)), held.stringSlot, textOf(held.stringValue)},
        1);
    return true;
  });
  comparison.error = readWithProgress(run, settings[0].period);
  takeReading(run, comparison);
}

// What became of each trace point in two periods.
class PointFigures {
 public:
  // A program that puts numbers into its names makes new trace points without end. Objects beyond
  // these bounds count in the sums of their side, but no change is found for them.
  static constexpr size_t kMost = 65536;
  static constexpr size_t kMostBytes = size_t{16} << 20;  // of subsystems, categories and names

  struct Sides {
    VerdictCounts counts[2] = {};
  };
  using Points = KeyedCounts<3, Sides>;

  // False if there is no room for the trace point of the object.
  bool count(const TesselObject& object, size_t side, TesselReporterClassification verdict) {
    const Points::Key key{{object.subsystem(), object.category(), object.name()}};
    Sides* sides = points_.find(key);
    if (sides == nullptr) {
      size_t bytes = bytes_;
      for (const StringRef text : key.texts) bytes += text.textOr("").size();
      if (points_.entries().size() >= kMost || bytes > kMostBytes) return false;
      bytes_ = bytes;
      sides = &points_.add(key);
    }
    ++sides->counts[side][verdict];
    return true;
  }
  const std::vector<Points::Entry>& entries() const { return points_.entries(); }

 private:
  Points points_;
  size_t bytes_ = 0;
};

// The verdict that held back most objects.
std::string mainReason(const VerdictCounts& counts) {
  if (sumOf(counts) == 0) return "not_recorded";
  // The first verdict is "reported", which is no reason. Among equal counts the first verdict wins,
  // so the answer does not depend on the order of the store.
  auto main = kVerdictOrder[1];
  for (const auto verdict : kVerdictOrder) {
    if (verdict != TesselReporterClassificationTelemetryReported && counts[verdict] > counts[main])
      main = verdict;
  }
  return std::string(verdictName(main));
}

// Two periods, each with a judge of its own. A judge that went on would have used up caps in the
// first period, and points of the second would seem to stop.
void comparePeriods(const Setting (&settings)[2], const Reading& reading, Comparison& comparison) {
  PointFigures points;
  // After an error the second reading is skipped: the command fails and shows no figures.
  for (size_t side = 0; side < 2 && !comparison.error; ++side) {
    Judge judge(settings[side].machine);
    ComparedPeriod& period = comparison.periods[side].emplace();
    if (side == 1) period.durations.expect(comparison.periods[0]->durations);
    DryRun run(reading.store, [&](const TesselObject& object, const EntryHeader&) {
      const auto verdict = judge.inspect(object).classification;
      ++comparison.sides[side][verdict];
      period.durations.count(object);
      if (!points.count(object, side, verdict)) ++comparison.notCompared;
      return true;
    });
    // Each period is half of the work on the progress bar.
    const double half = static_cast<double>(side) / 2;
    comparison.error = readWithProgress(run, settings[side].period, true, half, half + 0.5);
    takeReading(run, comparison);
    period.reading = run.report().store.reading;
  }
  for (const auto& [texts, slot, figures] : points.entries()) {
    const uint64_t before = figures.counts[0][TesselReporterClassificationTelemetryReported];
    const uint64_t after = figures.counts[1][TesselReporterClassificationTelemetryReported];
    // Traffic differs from day to day. So a change is only a point that was reported in one period
    // and not once in the other.
    if ((before == 0) == (after == 0)) continue;
    const bool starts = before == 0;
    comparison.changes.add({starts, textOf(texts[0]), textOf(texts[1]), textOf(texts[2]),
                            mainReason(figures.counts[starts ? 0 : 1]), 0, ""},
                           starts ? after : before);
  }
}

void writeChange(JsonWriter& json, const Change& change, uint64_t count) {
  json.object([&] {
    json.member("change", change.starts ? "start" : "stop");
    json.member("subsystem", change.subsystem).member("category", change.category);
    json.member("name", change.name).member("count", count).member("rule", change.why);
    if (change.slot != 0) json.member("slot", change.slot).member("value", change.value);
  });
}

void writePeriods(JsonWriter& json, const Comparison& comparison) {
  const auto& [a, b] = comparison.periods;
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

std::string comparisonText(const Comparison& comparison, const CompareOptions& options,
                           const Terminal& terminal) {
  Table sums({{"VERDICT"}, {"A", Table::Align::right}, {"B", Table::Align::right}});
  for (const auto verdict : kVerdictOrder) {
    sums.add({std::string(verdictName(verdict)), terminal.number(comparison.sides[0][verdict]),
              terminal.number(comparison.sides[1][verdict])});
  }
  Table table({{"CHANGE"},
               {"OBJECTS", Table::Align::right},
               {"TRACE POINT", Table::Align::left, true},
               {"RULE OF THE OTHER SIDE", Table::Align::left, true}});
  for (const auto& [change, count] : comparison.changes.listed()) {
    std::string rule = change.why;
    if (change.slot != 0) rule += " \"" + terminalText(change.value) + "\"";
    table.add({{change.starts ? "starts" : "stops", change.starts ? Colour::good : Colour::caution},
               terminal.number(count),
               terminalText(change.subsystem) + " / " + terminalText(change.category) + " / " +
                   terminalText(change.name),
               rule});
  }
  std::string out = "A: " + terminalText(options.settings[0]) +
                    "\nB: " + terminalText(options.settings[1]) + "\n\n" +
                    sums.render(terminal, 2) + "\n" +
                    wrapped("B would start to report " +
                                counted(comparison.changes.starting(), "object", "objects") +
                                " and stop to report " +
                                counted(comparison.changes.stopping(), "object", "objects") + ".",
                            terminal.width, 2) +
                    "\n";
  if (!table.empty()) out += "\n" + table.render(terminal, 2);
  if (const uint64_t count = comparison.changes.notListed(); count != 0)
    out += "  " + counted(count, "object", "objects") + " had further changes\n";
  if (const uint64_t count = comparison.notCompared; count != 0)
    out += "  " + counted(count, "object", "objects") + " of further trace points not compared\n";
  out += periodsText(comparison, terminal);
  if (!comparison.losses.empty()) out += "\n" + lossText(comparison.losses, terminal);
  return out;
}

int runCompare(const CompareOptions& options, const Surroundings& surroundings) {
  const auto reading = readingOf(options.reading, surroundings);
  if (!reading) return kUsage;
  const auto a = settingOf(options.settings[0], *reading, surroundings.now);
  const auto b = a ? settingOf(options.settings[1], *reading, surroundings.now) : std::nullopt;
  if (!b) return kUsage;
  const Setting settings[2] = {*a, *b};
  const bool samePeriod = a->period.start == b->period.start && a->period.end == b->period.end;
  Comparison comparison;
  (samePeriod ? compareJudges : comparePeriods)(settings, *reading, comparison);
  if (comparison.error) return failToRead(*comparison.error, reading->store);
  print(options.json ? comparisonJson(comparison)
                     : comparisonText(comparison, options, surroundings.terminal));
  flushOutput();
  return warnOfUnreadFiles(comparison.unread, reading->store);
}

const CommandText kCompare{
    "compare", "Say what starts or stops being reported, and what became slower",
    "A setting is one word or several with commas between: usual (nothing changed), internal,\n"
    "no-internal, a platform (as for --platform), since=DATE, until=DATE,\n"
    "last=DURATION. Over one period each trace object is judged twice. Over two periods the "
    "trace\n"
    "points are compared that are reported at all, and how long each took: what became slower\n"
    "comes first.\n\n"
    "Examples:\n"
    "  tesselctl compare since=-14d,until=-7d last=7d    (which became slower since last week)\n"
    "  tesselctl compare usual internal\n"
    "  tesselctl compare Selvin Quarro,internal --last 7d\n"
    "  tesselctl compare since=yesterday,until=today since=today"};

}  // namespace

void addCompareCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, kCompare, runCompare);
  command.add_option("A", options.settings[0], "Setting to start from")->required()->type_name("");
  command.add_option("B", options.settings[1], "Setting to compare with it")
      ->required()
      ->type_name("");
  addPeriodOptions(command, options.reading);
  command.add_flag("--json", options.json,
                   "One JSON object: a, b, starts, stops, changes, durations");
}

}  // namespace tessel::ctl
