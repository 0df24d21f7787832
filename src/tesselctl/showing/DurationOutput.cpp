// Quantiles of durations and frame rates, as JSON and as tables.
//
// For a duration the upper quantiles are what a user waits for. For a frame rate the lower ones are
// what a user sees as jerks, so only frame rates show them.
//
// On a terminal a value has three digits and a unit. Where there is no terminal, a program reads
// the table, so values are plain numbers of one unit and no row is left out.

#include "tesselctl/showing/DurationOutput.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <iterator>
#include <span>

#include "platform/Text.h"

namespace tessel::ctl {

namespace {

// The tables of a summary together fit on a few screens. JSON has all rows.
constexpr size_t kShownPoints = 20;

struct ShownUnit {
  double from;     // the least duration that is shown in it
  double seconds;  // that it has
  const char* name;
};
// People count in seconds up to two minutes, and in minutes up to two hours.
constexpr ShownUnit kShownUnits[] = {{2 * 86400, 86400, " d"}, {7200, 3600, " h"},
                                     {120, 60, " min"},        {1, 1, " s"},
                                     {1e-3, 1e-3, " ms"},      {1e-6, 1e-6, " us"}};

// Three digits. Above a million the digits before the point would be noise as well.
std::string threeDigits(double value) {
  char text[32];
  const double size = std::fabs(value);
  // to_chars() knows no locale, so a script reads the same on each machine.
  const auto end =
      size >= 1e6 ? std::to_chars(text, std::end(text), value, std::chars_format::scientific, 2)
                  : std::to_chars(text, std::end(text), value, std::chars_format::fixed,
                                  size < 9.995   ? 2
                                  : size < 99.95 ? 1
                                                 : 0);
  return {text, end.ptr};
}

struct Quantile {
  const char* name;
  double part;  // 0 is the minimum, 1 the maximum
};
constexpr Quantile kMin = {"min", 0}, kP1 = {"p1", 0.01}, kP5 = {"p5", 0.05}, kP50 = {"p50", 0.5},
                   kP95 = {"p95", 0.95}, kP99 = {"p99", 0.99}, kMax = {"max", 1};
constexpr Quantile kUpper[] = {kP50, kP95, kP99, kMax};
constexpr Quantile kLower[] = {kP50, kP5, kP1, kMin};
constexpr Quantile kAll[] = {kMin, kP1, kP5, kP50, kP95, kP99, kMax};

// How the values of a measure are shown.
struct Style {
  Measure measure;
  const char* key;    // of JSON
  const char* title;  // of a table
  const char* unit;   // of plain numbers
  std::span<const Quantile> quantiles;
  std::span<const Quantile> shown;  // in a table; a frame rate leaves the trace point some room
  std::string (*text)(float);
};
constexpr std::array<Style, 2> kStyles = {
    {{Measure::duration, "durations", "Durations", "seconds", kUpper, kUpper, secondsText},
     {Measure::frameRate, "frame_rates", "Frame rates", "frames per second", kAll, kLower,
      frameRateText}}};

float valueOf(const QuantileSketch& sketch, const Quantile& quantile) {
  return quantile.part == 0 ? sketch.minimum() : sketch.quantile(quantile.part);
}

std::string shownValue(const Style& style, float value, const Terminal& terminal) {
  return terminal.interactive ? style.text(value) : plainDigits(value);
}

// `exactness` is what holds for the figures beside the percentiles.
std::string heading(const Style& style, const char* exactness, const Terminal& terminal) {
  const std::string title =
      style.title + (terminal.interactive ? std::string() : std::string(" in ") + style.unit);
  std::string line = wrapped(title + ": " + kPercentileError + exactness, terminal.width, 2) + "\n";
  // Painted behind the wrapping, which would count the sequences of colours as columns.
  return "\n" + line.replace(0, title.size(), terminal.paint(Colour::strong, title));
}

// One table of names serves JSON and the headings, so a quantile has the same name in both.
std::string upper(std::string text) {
  std::ranges::transform(text, text.begin(), [](char c) { return c >= 'a' ? c - 'a' + 'A' : c; });
  return text;
}

// Of a row or a change.
std::string shownPath(const auto& point) {
  return pathText(point.subsystem.textOr(""), point.category.textOr(""), point.name.textOr(""));
}

// Each row has the same keys, as tools that make tables want it. So an absent text is empty.
void writePath(JsonWriter& json, const auto& point) {
  json.member("subsystem", point.subsystem.textOr(""));
  json.member("category", point.category.textOr("")).member("name", point.name.textOr(""));
}

void writeSketch(JsonWriter& json, const Style& style, const QuantileSketch& sketch) {
  json.member("count", sketch.count());
  for (const Quantile& quantile : style.quantiles) {
    // Without a value there is no quantile. JSON shows NaN as null.
    json.member(quantile.name, sketch.count() == 0 ? std::nanf("") : valueOf(sketch, quantile));
  }
}

// The lines below a table: what it does not show.
std::string remainder(size_t listed, size_t all, uint64_t furtherValues) {
  std::string out;
  if (all > listed) {
    out += "  ... and " + counted(all - listed, "more trace point", "more trace points") +
           " (--json lists all)\n";
  }
  if (furtherValues != 0)
    out += "  " + counted(furtherValues, "value", "values") + " of further trace points\n";
  return out;
}

std::string quantileTable(const Style& style, const Durations& durations,
                          const Terminal& terminal) {
  std::vector<Table::Column> columns = {{"COUNT", Table::Align::right}};
  for (const Quantile& quantile : style.shown)
    columns.push_back({upper(quantile.name), Table::Align::right});
  columns.push_back({"TRACE POINT", Table::Align::left, true});
  Table table(std::move(columns));
  auto rows = durations.rows(style.measure);
  uint64_t negative = 0;
  for (const Durations::Row& row : rows) negative += row.negative;
  // Rows without a value stand last, since the most values come first.
  while (!rows.empty() && rows.back().sketch.count() == 0) rows.pop_back();
  const size_t shown = std::min(rows.size(), terminal.limit(kShownPoints));
  for (const Durations::Row& row : std::span(rows).first(shown)) {
    std::vector<Table::Cell> cells = {terminal.number(row.sketch.count())};
    for (const Quantile& quantile : style.shown)
      cells.emplace_back(shownValue(style, valueOf(row.sketch, quantile), terminal));
    cells.emplace_back(shownPath(row));
    table.add(std::move(cells));
  }
  std::string out = table.empty() ? "" : table.render(terminal, 2);
  out += remainder(shown, rows.size(), durations.notListed(style.measure));
  if (negative != 0)
    out += "  " + counted(negative, "negative value", "negative values") + " left out\n";
  return out.empty() ? "" : heading(style, "; the rest is exact", terminal) + out;
}

using Verdict = DurationChange::Verdict;

struct VerdictText {
  const char* name;  // of JSON
  const char* text;
  Colour colour;
};
// In the order of Verdict.
constexpr VerdictText kVerdictTexts[] = {
    {"slower", "slower", Colour::bad},        {"same", "same", Colour::plain},
    {"faster", "faster", Colour::good},       {"few_values", "few values", Colour::faint},
    {"only_a", "only in A", Colour::caution}, {"only_b", "only in B", Colour::caution}};
static_assert(std::size(kVerdictTexts) == static_cast<size_t>(Verdict::onlyB) + 1);

const VerdictText& textOf(Verdict verdict) { return kVerdictTexts[static_cast<size_t>(verdict)]; }

bool inBoth(const DurationChange& change) {
  return change.verdict != Verdict::onlyA && change.verdict != Verdict::onlyB;
}

std::string factorText(const DurationChange& change) {
  return inBoth(change) ? threeDigits(change.factor) : "";
}

// Two lines for a trace point: on 80 columns two periods do not fit beside its name. The usual and
// the bad case are enough to see what the verdict rests on.
std::string changeLines(const Style& style, const DurationChange& change,
                        const Terminal& terminal) {
  constexpr size_t kIndent = 16;
  const auto both = [&](const std::string& a, const std::string& b) {
    return change.verdict == Verdict::onlyA   ? a
           : change.verdict == Verdict::onlyB ? b
                                              : a + " -> " + b;
  };
  std::string figures;
  for (const Quantile& quantile : style.shown.first(2)) {
    const auto side = [&](const QuantileSketch& sketch) {
      return sketch.count() == 0 ? "" : style.text(valueOf(sketch, quantile));
    };
    figures += std::string(quantile.name) + " " + both(side(*change.a), side(*change.b)) + ", ";
  }
  const auto values = [](const QuantileSketch& sketch) {
    return counted(sketch.count(), "value", "values");
  };
  figures += change.verdict == Verdict::onlyA ? values(*change.a)
                                              : both(grouped(change.a->count()), values(*change.b));
  const VerdictText& verdict = textOf(change.verdict);
  std::string label = verdict.text;
  if (change.verdict == Verdict::slower) label = threeDigits(change.factor) + "x slower";
  if (change.verdict == Verdict::faster) label = threeDigits(1 / change.factor) + "x faster";
  label.resize(std::max(label.size() + 1, kIndent - 2), ' ');
  return "  " + terminal.paint(verdict.colour, label) +
         wrappedBeside(shownPath(change), terminal.width, kIndent) + "\n" +
         std::string(kIndent, ' ') + wrappedBeside(figures, terminal.width, kIndent) + "\n";
}

// A row for a trace point, and each figure a column.
std::string changeTable(const Style& style, const std::vector<DurationChange>& changes,
                        const Terminal& terminal) {
  std::vector<Table::Column> columns = {{"CHANGE"}, {"FACTOR"}, {"COUNT A"}, {"COUNT B"}};
  for (const Quantile& quantile : style.shown) {
    for (const char* side : {" A", " B"}) columns.push_back({upper(quantile.name) + side});
  }
  columns.push_back({"TRACE POINT", Table::Align::left, true});
  Table table(std::move(columns));
  for (const DurationChange& change : changes) {
    std::vector<Table::Cell> cells = {textOf(change.verdict).name, factorText(change),
                                      terminal.number(change.a->count()),
                                      terminal.number(change.b->count())};
    for (const Quantile& quantile : style.shown) {
      for (const QuantileSketch* sketch : {change.a, change.b}) {
        cells.emplace_back(
            sketch->count() == 0 ? "" : shownValue(style, valueOf(*sketch, quantile), terminal));
      }
    }
    cells.emplace_back(shownPath(change));
    table.add(std::move(cells));
  }
  return table.render(terminal, 2);
}

// "1 slower, 12 same, 3 with few values".
std::string verdictCounts(const std::vector<DurationChange>& changes) {
  uint64_t counts[std::size(kVerdictTexts)] = {};
  for (const DurationChange& change : changes) ++counts[static_cast<size_t>(change.verdict)];
  std::string out;
  for (size_t verdict = 0; verdict < std::size(counts); ++verdict) {
    // "0 slower" is the answer that most people come for, so it is said.
    if (counts[verdict] == 0 && verdict != 0) continue;
    out += (out.empty() ? "" : ", ") + grouped(counts[verdict]) + " " + kVerdictTexts[verdict].text;
  }
  return out;
}

std::string changesText(const Style& style, const Durations& a, const Durations& b,
                        const Terminal& terminal) {
  const uint64_t further = a.notListed(style.measure) + b.notListed(style.measure);
  const auto changes = changesBetween(a, b, style.measure);
  // A heading above nothing would suggest that nothing became slower, though nothing was measured.
  if (changes.empty() && further == 0) return "";
  // A factor divides two percentiles, so their errors meet.
  static_assert((1 + QuantileSketch::kError) / (1 - QuantileSketch::kError) < 1.032);
  std::string out = heading(style, ", a factor 3.2 %; the rest is exact", terminal);
  out += "  " + wrapped(verdictCounts(changes), terminal.width, 2) + "\n";
  if (!terminal.interactive)
    return out + changeTable(style, changes, terminal) + remainder(0, 0, further);
  const size_t shown = std::min(changes.size(), terminal.limit(kShownPoints));
  for (const DurationChange& change : std::span(changes).first(shown))
    out += changeLines(style, change, terminal);
  return out + remainder(shown, changes.size(), further);
}

}  // namespace

std::string secondsText(float seconds) {
  const double size = std::fabs(seconds);
  if (size < 5e-12) return "0 s";  // which nanoseconds with two decimals would show as 0.00
  for (const ShownUnit& unit : kShownUnits) {
    if (size >= unit.from) return threeDigits(seconds / unit.seconds) + unit.name;
  }
  return threeDigits(seconds / 1e-9) + " ns";
}

std::string plainDigits(float value) {
  char text[32];  // of a float up to 15
  return {text, std::to_chars(text, std::end(text), value).ptr};
}

std::string frameRateText(float rate) { return threeDigits(rate) + " fps"; }

void addDurations(JsonWriter& json, const Durations& durations) {
  for (const Style& style : kStyles) {
    json.array(style.key, durations.rows(style.measure), [&](const Durations::Row& row) {
      json.object([&] {
        writePath(json, row);
        writeSketch(json, style, row.sketch);
        json.member("negative", row.negative);
      });
    });
    json.member(std::string(style.key) + "_not_listed", durations.notListed(style.measure));
  }
}

std::string durationText(const Durations& durations, const Terminal& terminal) {
  std::string out;
  for (const Style& style : kStyles) out += quantileTable(style, durations, terminal);
  return out;
}

void addDurationChanges(JsonWriter& json, const Durations& a, const Durations& b) {
  for (const Style& style : kStyles) {
    json.array(style.key, changesBetween(a, b, style.measure), [&](const DurationChange& change) {
      json.object([&] {
        json.member("change", textOf(change.verdict).name);
        json.member("factor", inBoth(change) ? change.factor : std::nan(""));
        writePath(json, change);
        json.object("a", [&] { writeSketch(json, style, *change.a); });
        json.object("b", [&] { writeSketch(json, style, *change.b); });
      });
    });
    json.object(std::string(style.key) + "_not_listed", [&] {
      json.member("a", a.notListed(style.measure)).member("b", b.notListed(style.measure));
    });
  }
}

std::string durationChangesText(const Durations& a, const Durations& b, const Terminal& terminal) {
  std::string out;
  for (const Style& style : kStyles) out += changesText(style, a, b, terminal);
  return out;
}

}  // namespace tessel::ctl
