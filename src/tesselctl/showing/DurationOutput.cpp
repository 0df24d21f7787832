// Quantiles of durations and frame rates, as JSON and as tables.
//
// For a duration the upper quantiles are what a user waits for. For a frame rate the lower ones are
// what a user sees as jerks, so only frame rates show them.

#include "tesselctl/showing/DurationOutput.h"

#include <charconv>
#include <cmath>
#include <iterator>
#include <span>

#include "platform/Text.h"

namespace tessel::ctl {

namespace {

// The tables of a summary together fit on a few screens. JSON has all rows.
constexpr size_t kShownPoints = 20;

struct Unit {
  double from;     // the least duration that is shown in it
  double seconds;  // that it has
  const char* name;
};
// People count in seconds up to two minutes, and in minutes up to two hours.
constexpr Unit kUnits[] = {{2 * 86400, 86400, " d"}, {7200, 3600, " h"},
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

// Programs sort and compare, which one unit for all values lets them do.
std::string plainDigits(float value) {
  char text[32];  // of a float up to 15
  return {text, std::to_chars(text, std::end(text), value).ptr};
}

std::string shownPath(const Durations::Row& row) {
  std::string path = terminalText(row.subsystem.textOr("-")) + " / ";
  path += terminalText(row.category.textOr("-"));
  if (row.name) path += " / " + terminalText(row.name.text());
  return path;
}

struct Quantile {
  const char* key;    // of JSON
  const char* title;  // of a column
  double part;        // 0 is the minimum, 1 the maximum
};
constexpr Quantile kDurationQuantiles[] = {
    {"p50", "P50", 0.5}, {"p95", "P95", 0.95}, {"p99", "P99", 0.99}, {"max", "MAX", 1}};
constexpr Quantile kFrameRateQuantiles[] = {
    {"min", "MIN", 0},    {"p1", "P1", 0.01},   {"p5", "P5", 0.05}, {"p50", "P50", 0.5},
    {"p95", "P95", 0.95}, {"p99", "P99", 0.99}, {"max", "MAX", 1}};
// The upper ones leave the table room for the trace point.
constexpr std::span<const Quantile> kShownFrameRates = std::span(kFrameRateQuantiles).first(4);

float valueOf(const QuantileSketch& sketch, const Quantile& quantile) {
  return quantile.part == 0 ? sketch.minimum() : sketch.quantile(quantile.part);
}

void writeRows(JsonWriter& json, const char* key, const std::vector<Durations::Row>& rows,
               std::span<const Quantile> quantiles) {
  json.array(key, rows, [&](const Durations::Row& row) {
    json.object([&] {
      // Each row has the same keys, as tools that make tables want it. So an absent text is empty.
      json.member("subsystem", row.subsystem.textOr(""));
      json.member("category", row.category.textOr("")).member("name", row.name.textOr(""));
      json.member("count", row.sketch.count());
      for (const Quantile& quantile : quantiles) {
        // Where all values were negative there is no quantile; JSON shows NaN as null.
        json.member(quantile.key,
                    row.sketch.count() == 0 ? std::nanf("") : valueOf(row.sketch, quantile));
      }
      json.member("negative", row.negative);
    });
  });
}

std::string quantileTable(const Durations& durations, Measure measure,
                          std::span<const Quantile> quantiles, std::string (*shown)(float),
                          const Terminal& terminal) {
  std::vector<Table::Column> columns = {{"COUNT", Table::Align::right}};
  for (const Quantile& quantile : quantiles)
    columns.push_back({quantile.title, Table::Align::right});
  columns.push_back({"TRACE POINT", Table::Align::left, true});
  Table table(std::move(columns));
  const auto rows = durations.rows(measure);
  uint64_t negative = 0;
  size_t listed = 0;
  const size_t most = terminal.limit(kShownPoints);
  for (const Durations::Row& row : rows) {
    negative += row.negative;
    if (row.sketch.count() == 0 || listed == most) continue;
    ++listed;
    std::vector<Table::Cell> cells = {terminal.number(row.sketch.count())};
    for (const Quantile& quantile : quantiles) {
      const float value = valueOf(row.sketch, quantile);
      cells.emplace_back(terminal.interactive ? shown(value) : plainDigits(value));
    }
    cells.emplace_back(shownPath(row));
    table.add(std::move(cells));
  }
  std::string out = table.empty() ? "" : table.render(terminal, 2);
  if (rows.size() > listed && listed == most) {
    out += "  ... and " + grouped(rows.size() - listed) + " more trace points (--json lists all)\n";
  }
  if (const uint64_t count = durations.notListed(measure); count != 0)
    out += "  " + counted(count, "value", "values") + " of further trace points\n";
  if (negative != 0)
    out += "  " + counted(negative, "negative value", "negative values") + " left out\n";
  return out;
}

}  // namespace

std::string secondsText(float seconds) {
  const double size = std::fabs(seconds);
  if (size < 5e-12) return "0 s";  // which nanoseconds with two decimals would show as 0.00
  for (const Unit& unit : kUnits) {
    if (size >= unit.from) return threeDigits(seconds / unit.seconds) + unit.name;
  }
  return threeDigits(seconds / 1e-9) + " ns";
}

std::string frameRateText(float rate) { return threeDigits(rate) + " fps"; }

void addDurations(JsonWriter& json, const Durations& durations) {
  writeRows(json, "durations", durations.rows(Measure::duration), kDurationQuantiles);
  json.member("durations_not_listed", durations.notListed(Measure::duration));
  writeRows(json, "frame_rates", durations.rows(Measure::frameRate), kFrameRateQuantiles);
  json.member("frame_rates_not_listed", durations.notListed(Measure::frameRate));
}

std::string durationText(const Durations& durations, const Terminal& terminal) {
  const std::string tables[] = {
      quantileTable(durations, Measure::duration, kDurationQuantiles, secondsText, terminal),
      quantileTable(durations, Measure::frameRate, kShownFrameRates, frameRateText, terminal)};
  std::string out;
  if (!tables[0].empty()) {
    const std::string unit = terminal.interactive ? "" : " in seconds";
    out += "\n" + terminal.paint(Colour::strong, "Durations" + unit + ", within 1.6 %") + "\n" +
           tables[0];
  }
  if (!tables[1].empty())
    out += "\n" + terminal.paint(Colour::strong, "Frame rates") + "\n" + tables[1];
  return out;
}

}  // namespace tessel::ctl
