// Writing the long lists.

#include "tesselctl/showing/HtmlLists.h"

#include <algorithm>
#include <map>
#include <span>
#include <string>
#include <tuple>
#include <vector>

#include "tesselctl/showing/DurationOutput.h"
#include "tesselctl/showing/HtmlCharts.h"

namespace tessel::ctl {

namespace {

// Entries that are in sight at once: as many as a screen has. A few more are shown as well,
// because a disclosure for them would take their place.
constexpr size_t kInSight = 20;
constexpr size_t kInSightAlone = 25;

// A list by its greatest entries, and then as a whole. `table(entries, id, caption, use)` writes
// the table of some entries; `id` is one for the whole list, and another for a part of it.
template <typename Entry, typename Table>
Html inTwoParts(std::span<const Entry> entries, const std::string& id, const std::string& things,
                const std::string& order, Table&& table) {
  const std::string all = grouped(entries.size()) + " " + things;
  if (entries.size() <= kInSightAlone)
    return table(entries, id, all + ", " + order, TableUse::search);
  const std::string greatest = "The first " + std::to_string(kInSight) + " of " + all;
  Html html;
  return html << table(entries.first(kInSight), id + "_first", greatest + ", " + order,
                       TableUse::read)
              << "<details><summary>All " << all << "</summary>\n"
              << table(entries, id, all, TableUse::search) << "</details>\n";
}

// Each bar has the full width, so that rows with few objects can be read as well as rows with many.
// How many there are stands in a column of its own.
Html pairTable(std::span<const Tally::Pair> pairs, const std::string& id,
               const std::string& caption, TableUse use, Names& names) {
  Html html;
  html << tableHead(id, Html() << caption,
                    {{"Subsystem / category"},
                     {"Objects", Column::Kind::number},
                     {"Reported", Column::Kind::number},
                     {"Verdicts, 100 %", Column::Kind::chart}},
                    use);
  for (const Tally::Pair& pair : pairs) {
    html << "<tr><th scope=\"row\">" << names(pair.subsystem, pair.category)
         << "</th><td class=\"n\">" << sumOf(pair.counts) << "</td><td class=\"n\">"
         << pair.counts[TesselReporterClassificationTelemetryReported] << "</td><td class=\"bar\">"
         << verdictBar(pair.counts, BarSize::row) << "</td></tr>\n";
  }
  return html << tableEnd();
}

// Unknown values that people decide about together: equal values, or all values of a trace point.
struct MissGroup {
  uint64_t count = 0;
  std::vector<const Tally::Miss*> misses;
};

// Most frequent first. Equal counts are ordered by what makes the group, as the map is.
template <typename KeyOf>
std::vector<MissGroup> groupedMisses(const std::vector<Tally::Miss>& misses, KeyOf&& keyOf) {
  // A map and no hash table: its order makes equal counts stand alike on each page, so two pages
  // can be compared.
  std::map<decltype(keyOf(misses.front())), MissGroup> groups;
  for (const Tally::Miss& miss : misses) {
    MissGroup& group = groups[keyOf(miss)];
    group.count += miss.count;
    group.misses.push_back(&miss);
  }
  std::vector<MissGroup> sorted;
  sorted.reserve(groups.size());
  for (auto& [key, group] : groups) sorted.push_back(std::move(group));
  std::ranges::stable_sort(sorted, std::greater{}, &MissGroup::count);
  return sorted;
}

Html missedPoint(const Tally::Miss& miss, Names& names) {
  Html html;
  return html << names(miss.subsystem, miss.category, miss.name) << " <span class=\"soft\">string "
              << std::to_string(miss.slot) << "</span>";
}

// One trace point stands in the row. More wait behind a disclosure, or one value of many trace
// points would push the others out of sight.
Html missedPoints(const MissGroup& group, Names& names) {
  Html html;
  if (group.misses.size() == 1) return html << missedPoint(*group.misses.front(), names);
  html << "<details><summary>" << counted(group.misses.size(), "trace point", "trace points")
       << "</summary><ul>";
  for (const Tally::Miss* miss : group.misses)
    html << "<li>" << miss->count << " &times; " << missedPoint(*miss, names) << "</li>";
  return html << "</ul></details>";
}

// A value is what somebody decides about: put it on a list or tell its author. So values make the
// rows, and trace points stand beside them.
Html missTable(std::span<const MissGroup> groups, const std::string& id, const std::string& caption,
               TableUse use, Names& names) {
  Html html;
  html << tableHead(id, Html() << caption,
                    {{"Value"}, {"Times", Column::Kind::number}, {"Trace points"}}, use);
  for (const MissGroup& group : groups) {
    html << "<tr><th scope=\"row\"><code>" << names(group.misses.front()->value)
         << "</code></th><td class=\"n\">" << group.count << "</td><td>"
         << missedPoints(group, names) << "</td></tr>\n";
  }
  return html << tableEnd();
}

// For a page that leaves this machine. The values may hold what nobody meant to pass on, so only
// their number stands here.
Html missedPointTable(std::span<const MissGroup> groups, const std::string& id,
                      const std::string& caption, TableUse use, Names& names) {
  Html html;
  html << tableHead(
      id, Html() << caption,
      {{"Trace point"}, {"Times", Column::Kind::number}, {"Values", Column::Kind::number}}, use);
  for (const MissGroup& group : groups) {
    html << "<tr><th scope=\"row\">" << missedPoint(*group.misses.front(), names)
         << "</th><td class=\"n\">" << group.count << "</td><td class=\"n\">"
         << uint64_t{group.misses.size()} << "</td></tr>\n";
  }
  return html << tableEnd();
}

// What the tables of durations and of frame rates differ in. For a duration the upper quantiles are
// what a user waits for. For a frame rate the lower ones are what a user sees as jerks.
struct QuantileColumn {
  const char* title;
  double part;  // 0 is the minimum, 1 the maximum
};
struct MeasureWords {
  Measure measure;
  const char* id;
  const char* order;
  std::string (*shown)(float);
  QuantileColumn quantiles[4];
};
constexpr MeasureWords kDurationWords = {
    Measure::duration,
    "durations",
    "most durations first",
    secondsText,
    {{"p50", 0.5}, {"p95", 0.95}, {"p99", 0.99}, {"Longest", 1}}};
constexpr MeasureWords kFrameRateWords = {
    Measure::frameRate,
    "frame_rates",
    "most frame rates first",
    frameRateText,
    {{"Lowest", 0}, {"p1", 0.01}, {"p5", 0.05}, {"p50", 0.5}}};

Html quantileTable(std::span<const Durations::Row> rows, const std::string& id,
                   const std::string& caption, TableUse use, const MeasureWords& words,
                   const Histograms& histograms, Names& names) {
  constexpr auto kNumber = Column::Kind::number;
  Html html;
  // Seven columns do not fit a telephone. The table scrolls in a region of its own, which the
  // keyboard can reach, and the page around it stays where it is.
  html << "<div class=\"scroll\" tabindex=\"0\" role=\"region\" aria-label=\"" << caption << "\">\n"
       << tableHead(id, Html() << caption,
                    {{"Trace point"},
                     {"Count", kNumber},
                     {words.quantiles[0].title, kNumber},
                     {words.quantiles[1].title, kNumber},
                     {words.quantiles[2].title, kNumber},
                     {words.quantiles[3].title, kNumber},
                     {"Spread", Column::Kind::chart}},
                    use);
  for (const Durations::Row& row : rows) {
    html << "<tr><th scope=\"row\">"
         << names(row.subsystem.textOr(""), row.category.textOr(""), row.name.textOr(""))
         << "</th><td class=\"n\">" << row.sketch.count() << "</td>";
    for (const auto& [title, part] : words.quantiles) {
      const float value = part == 0 ? row.sketch.minimum() : row.sketch.quantile(part);
      html << "<td class=\"n\">";
      html.quantity(value, words.shown(value)) << "</td>";
    }
    html << "<td class=\"bar\">" << histograms.html(row.sketch, words.shown) << "</td></tr>\n";
  }
  return html << tableEnd() << "</div>\n";
}

Html quantileList(const Durations& durations, const MeasureWords& words, Names& names) {
  auto rows = durations.rows(words.measure);
  uint64_t negative = 0;
  Histograms histograms;
  std::vector<Durations::Row> shown;
  // All histograms share one axis, or two rows could not be compared by eye. So we look at all rows
  // before we draw the first.
  for (const Durations::Row& row : rows) {
    negative += row.negative;
    // A trace point with negative values alone has no quantile to show. Its values count below.
    if (row.sketch.count() == 0) continue;
    shown.push_back(row);
    histograms.include(row.sketch);
  }
  Html html;
  if (!shown.empty()) {
    html << inTwoParts(std::span<const Durations::Row>(shown), words.id,
                       shown.size() == 1 ? "trace point" : "trace points", words.order,
                       [&](std::span<const Durations::Row> some, const std::string& id,
                           const std::string& caption, TableUse use) {
                         return quantileTable(some, id, caption, use, words, histograms, names);
                       })
         << "<p class=\"soft\">All spreads go from " << histograms.range(words.shown)
         << ". A bar is for values up to twice as large as those of the bar before.</p>\n";
  }
  if (const uint64_t count = durations.notListed(words.measure); count != 0)
    html << "<p class=\"soft\">" << counted(count, "value", "values")
         << " of further trace points, for which this list has no room.</p>\n";
  if (negative != 0)
    html << "<p class=\"soft\">" << counted(negative, "negative value", "negative values")
         << " left out.</p>\n";
  return html;
}

}  // namespace

Html pairSection(const Tally& tally, Names& names) {
  // The legend stands once above all bars: repeated in each row it would be most of the page.
  const auto pairs = tally.pairs();
  const auto table = [&](std::span<const Tally::Pair> some, const std::string& id,
                         const std::string& caption,
                         TableUse use) { return pairTable(some, id, caption, use, names); };
  Html html;
  return html << "<section>\n<h2>By subsystem and category</h2>\n"
              << legend(tally.verdicts())
              << inTwoParts(std::span<const Tally::Pair>(pairs), "pairs",
                            pairs.size() == 1 ? "pair" : "pairs", "most objects first", table)
              << "</section>\n";
}

Html missSection(const Tally& tally, RecordedValues values, Names& names) {
  const auto misses = tally.misses();
  Html html;
  // Without a miss the section is left out: its heading alone would look like a fault.
  if (misses.empty() && tally.missesNotListed() == 0) return html;
  html << "<section>\n<h2>Values that are not known ones</h2>\n<p class=\"soft\">Text values for "
          "which the whitelist held trace points back. These trace points are not reported.</p>\n";
  if (values == RecordedValues::shown) {
    const auto groups = groupedMisses(misses, [](const Tally::Miss& miss) { return miss.value; });
    html << inTwoParts(
        std::span<const MissGroup>(groups), "misses", groups.size() == 1 ? "value" : "values",
        "most frequent first",
        [&](std::span<const MissGroup> some, const std::string& id, const std::string& caption,
            TableUse use) { return missTable(some, id, caption, use, names); });
  } else {
    const auto groups = groupedMisses(misses, [](const Tally::Miss& miss) {
      return std::tie(miss.subsystem, miss.category, miss.name, miss.slot);
    });
    html << inTwoParts(
        std::span<const MissGroup>(groups), "misses", groups.size() == 1 ? "string" : "strings",
        "most frequent first",
        [&](std::span<const MissGroup> some, const std::string& id, const std::string& caption,
            TableUse use) { return missedPointTable(some, id, caption, use, names); });
  }
  if (tally.missesNotListed() != 0) {
    html << "<p class=\"soft\">" << tally.missesNotListed()
         << " more trace objects had further values, for which this list has no room.</p>\n";
  }
  return html << "</section>\n";
}

Html durationSection(const Tally& tally, Names& names) {
  const Html durations = quantileList(tally.durations(), kDurationWords, names);
  const Html frameRates = quantileList(tally.durations(), kFrameRateWords, names);
  Html html;
  if (!durations.text().empty()) {
    html << "<section>\n<h2>How long they took</h2>\n<p class=\"soft\">Trace points of all "
            "verdicts; "
         << kPercentileError << "; counts and longest durations are exact.</p>\n"
         << durations << "</section>\n";
  }
  if (!frameRates.text().empty()) {
    html << "<section>\n<h2>Frame rates</h2>\n<p class=\"soft\">Trace points of all verdicts; "
         << kPercentileError << "; counts and lowest rates are exact.</p>\n"
         << frameRates << "</section>\n";
  }
  return html;
}

}  // namespace tessel::ctl
