// Writing the report page.
//
// Programs recorded the texts on the page, and a hostile program may record a script. So the page
// forbids all scripts, and we draw the charts here, as SVG. The price: a chart cannot be zoomed or
// filtered. It only shows the title of the part under the pointer.

#include "tesselctl/showing/HtmlReport.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cmath>

#include "tesselctl/showing/Html.h"
#include "tesselctl/showing/Losses.h"
#include "tesselctl/showing/ReportStyle.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

Html& Html::at(double value) {
  std::array<char, 32> digits{};
  const auto end = std::to_chars(digits.data(), digits.data() + digits.size(), value,
                                 std::chars_format::fixed, 2)
                       .ptr;
  text_.append(digits.data(), end);
  return *this;
}

namespace {

// People read the page, and nobody reads thousands of rows. A program that needs every pair and
// value takes `explain --summary --json`.
constexpr size_t kPairsOnPage = 40;
constexpr size_t kMissesOnPage = 60;
// Drawings have units of their own and are stretched to the width of the page.
constexpr double kChartWidth = 1000;
constexpr double kChartHeight = 200;

// Escaping already keeps recorded text from becoming markup. The policy is the second line: should
// markup slip through one day, the browser still loads and runs nothing.
constexpr char kPolicy[] =
    "<meta http-equiv=\"Content-Security-Policy\" content=\"default-src 'none'; style-src "
    "'unsafe-inline'\">\n";

double ratio(uint64_t part, uint64_t whole) {
  return whole == 0 ? 0 : static_cast<double>(part) / static_cast<double>(whole);
}

// A count that is not zero is never shown as "0.0 %": a reader would take it for none.
std::string percent(uint64_t part, uint64_t whole) {
  if (whole == 0) return "0 %";
  const double share = ratio(part, whole) * 100;
  if (part != 0 && share < 0.1) return "< 0.1 %";
  const auto tenths = static_cast<uint64_t>(std::llround(share * 10));
  return std::to_string(tenths / 10) + "." + std::to_string(tenths % 10) + " %";
}

// The words for a verdict, with a capital letter for the heading of a row or column.
std::string title(TesselReporterClassification verdict) {
  std::string words(classificationRow(verdict).title);
  words[0] = static_cast<char>(std::toupper(words[0]));
  return words;
}

// "12 reported, 3 downsampled": what a chart says to those who cannot see it.
std::string spoken(const VerdictCounts& counts) {
  std::string words;
  for (const auto verdict : kVerdictOrder) {
    if (counts[verdict] == 0) continue;
    words += (words.empty() ? "" : ", ") + grouped(counts[verdict]) + " " +
             std::string(verdictName(verdict));
  }
  return words.empty() ? "none" : words;
}

// A bar of all verdicts, `scale` units wide. The classes are verdict names: the style has a colour
// for each, which is checked when it is compiled.
Html bar(const VerdictCounts& counts, double scale) {
  Html html;
  const uint64_t total = sumOf(counts);
  double x = 0;
  for (const auto verdict : kVerdictOrder) {
    if (counts[verdict] == 0) continue;
    const double width = ratio(counts[verdict], total) * scale;
    html << "<rect class=\"" << verdictName(verdict) << "\" x=\"";
    html.at(x) << "\" width=\"";
    html.at(width) << "\" height=\"10\"><title>" << title(verdict) << ": "
                   << grouped(counts[verdict]) << "</title></rect>";
    x += width;
  }
  return html;
}

Html legend(const VerdictCounts& counts) {
  Html html;
  html << "<ul class=\"legend\">";
  for (const auto verdict : kVerdictOrder) {
    if (counts[verdict] == 0) continue;
    html << "<li><span class=\"key " << verdictName(verdict) << "\"></span>" << title(verdict)
         << "</li>";
  }
  return html << "</ul>\n";
}

// Each tile has an id, and its count stands plain in an attribute. So a program can read the
// figures although people see them in groups of three digits.
Html tiles(const Tally& tally, const ExtractionReport& report) {
  const uint64_t objects = tally.traceObjects();
  const uint64_t reported = tally.verdicts()[TesselReporterClassificationTelemetryReported];
  Html html;
  html << "<div class=\"tiles\">\n<div class=\"tile\" id=\"log_events\"><b>" << report.entriesRead
       << "</b>log events read</div>\n<div class=\"tile\" id=\"trace_objects\"><b>" << objects
       << "</b>trace objects</div>\n<div class=\"tile main\" id=\"reported\"><b>" << reported
       << "</b>reported, " << percent(reported, objects)
       << "</div>\n<div class=\"tile\" id=\"held_back\"><b>" << (objects - reported)
       << "</b>held back, " << percent(objects - reported, objects) << "</div>\n</div>\n";
  return html;
}

Html verdictSection(const Tally& tally) {
  const VerdictCounts& counts = tally.verdicts();
  Html html;
  html << "<section>\n<h2>What became of them</h2>\n";
  if (tally.traceObjects() != 0) {
    html << "<svg class=\"share\" viewBox=\"0 0 1000 10\" preserveAspectRatio=\"none\" "
            "role=\"img\" aria-label=\""
         << spoken(counts) << "\">" << bar(counts, kChartWidth) << "</svg>\n";
  }
  html << "<div class=\"scroll\"><table id=\"verdicts\"><tr><th>Verdict</th><th "
          "class=\"n\">Objects</th>"
          "<th class=\"n\">Share</th></tr>\n";
  for (const auto verdict : kVerdictOrder) {
    html << "<tr id=\"verdict-" << verdictName(verdict) << "\"><td><span class=\"key "
         << verdictName(verdict) << "\"></span>" << title(verdict) << "</td><td class=\"n\">"
         << counts[verdict] << "</td><td class=\"n\">"
         << percent(counts[verdict], tally.traceObjects()) << "</td></tr>\n";
  }
  return html << "</table></div>\n</section>\n";
}

// The least round number that is not below `highest`. The steps are so close that the highest
// column fills at least half of the chart.
uint64_t roundTop(uint64_t highest) {  // at least 1, because heights are shares of it
  for (uint64_t unit = 1;; unit *= 10) {
    for (const uint64_t step : {1U, 2U, 3U, 4U, 5U, 6U, 8U}) {
      if (unit * step >= highest) return unit * step;
    }
  }
}

std::string sliceName(const Tally& tally, size_t slice) {
  const std::string date = dateText(tally.sliceStart(slice));
  const bool wholeDays = tally.sliceLength() >= std::chrono::hours{24};
  return wholeDays ? date.substr(0, 10) : date.substr(5, 11);
}

// A drawing counts y from the top down, so a column starts at the bottom and each part moves up.
// The gap between columns is 24 % of a step. `top` is at least the highest sum: no column leaves
// the chart.
Html columns(const Tally& tally, uint64_t top) {
  Html html;
  const double step = kChartWidth / static_cast<double>(tally.slices().size());
  for (size_t slice = 0; slice < tally.slices().size(); ++slice) {
    const VerdictCounts& counts = tally.slices()[slice];
    double y = kChartHeight;
    html << "<g><title>" << sliceName(tally, slice) << ": " << spoken(counts) << "</title>";
    for (const auto verdict : kVerdictOrder) {
      if (counts[verdict] == 0) continue;
      const double height = ratio(counts[verdict], top) * kChartHeight;
      y -= height;
      html << "<rect class=\"" << verdictName(verdict) << "\" x=\"";
      html.at(static_cast<double>(slice) * step + step * 0.12) << "\" y=\"";
      html.at(y) << "\" width=\"";
      html.at(step * 0.76) << "\" height=\"";
      html.at(height) << "\"/>";
    }
    html << "</g>\n";
  }
  return html;
}

Html sliceTable(const Tally& tally) {
  Html html;
  html << "<details><summary>The same as a table</summary><div class=\"scroll\"><table "
          "id=\"slices\"><tr><th>From</th>";
  for (const auto verdict : kVerdictOrder) html << "<th class=\"n\">" << title(verdict) << "</th>";
  html << "</tr>\n";
  for (size_t slice = 0; slice < tally.slices().size(); ++slice) {
    // A quiet week would fill the table with rows of zeros.
    if (sumOf(tally.slices()[slice]) == 0) continue;
    html << "<tr><td>" << sliceName(tally, slice) << "</td>";
    for (const auto verdict : kVerdictOrder)
      html << "<td class=\"n\">" << tally.slices()[slice][verdict] << "</td>";
    html << "</tr>\n";
  }
  return html << "</table></div></details>\n";
}

Html timeSection(const Tally& tally) {
  uint64_t highest = 0;
  size_t busiest = 0;
  for (size_t slice = 0; slice < tally.slices().size(); ++slice) {
    if (sumOf(tally.slices()[slice]) <= highest) continue;
    highest = sumOf(tally.slices()[slice]);
    busiest = slice;
  }
  const uint64_t top = roundTop(highest);
  Html html;
  html << "<section>\n<h2>Over time</h2>\n<p class=\"soft\">Trace objects; a column is "
       << durationText(tally.sliceLength())
       << "</p>\n<div class=\"chart\"><div class=\"ticks\" aria-hidden=\"true\"><span>"
       << grouped(top) << "</span><span>" << (top % 2 == 0 ? grouped(top / 2) : std::string())
       << "</span><span>0</span></div>\n<svg viewBox=\"0 0 1000 200\" preserveAspectRatio=\"none\" "
          "role=\"img\" "
          "aria-label=\"Trace objects over time; most, "
       << grouped(sumOf(tally.slices()[busiest])) << ", from " << sliceName(tally, busiest)
       << ". The table below has all figures.\">\n"
          "<path class=\"grid\" d=\"M0 0H1000M0 100H1000M0 200H1000\"/>\n"
       << columns(tally, top) << "</svg>\n<div class=\"times\" aria-hidden=\"true\">";
  const size_t last = tally.slices().size() - 1;
  for (const size_t slice : {size_t{0}, last / 2, last}) {
    if (slice == 0 || last > 1) html << "<span>" << sliceName(tally, slice) << "</span>";
  }
  return html << "</div></div>\n"
              << legend(tally.verdicts()) << sliceTable(tally) << "</section>\n";
}

Html pairSection(const Tally& tally) {
  const auto pairs = tally.pairs();
  Html html;
  html << "<section>\n<h2>By subsystem and category</h2>\n<p class=\"soft\">"
       << counted(pairs.size(), "pair", "pairs") << ", most objects first</p>\n"
       << "<div class=\"scroll\"><table id=\"pairs\"><tr><th>Subsystem / category</th><th "
          "class=\"n\">Objects</th>"
          "<th class=\"n\">Reported</th><th></th></tr>\n";
  const uint64_t most = pairs.empty() ? 1 : sumOf(pairs.front().counts);
  for (size_t at = 0; at < std::min(pairs.size(), kPairsOnPage); ++at) {
    const Tally::Pair& pair = pairs[at];
    const uint64_t total = sumOf(pair.counts);
    html << "<tr><td class=\"name\">" << pair.subsystem << " <span class=\"soft\">/ "
         << pair.category << "</span></td><td class=\"n\">" << total << "</td><td class=\"n\">"
         << pair.counts[TesselReporterClassificationTelemetryReported]
         << "</td><td class=\"bar\"><svg class=\"pair\" viewBox=\"0 0 1000 10\" "
            "preserveAspectRatio=\"none\" "
            "role=\"img\" aria-label=\""
         << spoken(pair.counts) << "\"><rect class=\"track\" width=\"1000\" height=\"10\"/>"
         << bar(pair.counts, ratio(total, most) * kChartWidth) << "</svg></td></tr>\n";
  }
  html << "</table></div>\n";
  if (pairs.size() > kPairsOnPage) {
    html << "<p class=\"soft\">... and " << grouped(pairs.size() - kPairsOnPage) << " more</p>\n";
  }
  return html << legend(tally.verdicts()) << "</section>\n";
}

Html missSection(const Tally& tally) {
  const auto misses = tally.misses();
  Html html;
  // Without a miss the section is left out: its heading alone would look like a fault.
  if (misses.empty()) return html;
  html << "<section>\n<h2>Values that are not known ones</h2>\n<p class=\"soft\">Text values for "
          "which the whitelist "
          "held trace points back. They stay on this machine.</p>\n"
          "<div class=\"scroll\"><table id=\"misses\"><tr><th "
          "class=\"n\">Times</th><th>Value</th><th>Trace point</th>"
          "<th class=\"n wide\">String</th></tr>\n";
  for (size_t at = 0; at < std::min(misses.size(), kMissesOnPage); ++at) {
    const Tally::Miss& miss = misses[at];
    html << "<tr><td class=\"n\">" << miss.count << "</td><td><code>"
         << shortened(replaceInvalidUtf8(miss.value), 80) << "</code></td><td class=\"name\">"
         << miss.subsystem << " <span class=\"soft\">/ " << miss.category << " / " << miss.name
         << "</span></td><td class=\"n wide\">" << std::to_string(miss.slot) << "</td></tr>\n";
  }
  html << "</table></div>\n";
  if (misses.size() > kMissesOnPage || tally.missesNotListed() != 0) {
    html << "<p class=\"soft\">Further values are not listed here; <code>tesselctl explain "
            "--summary --json</code> "
            "lists them.</p>\n";
  }
  return html << "</section>\n";
}

Html kindSection(const Tally& tally) {
  Html html;
  html << "<section>\n<h2>By kind</h2>\n<div class=\"scroll\"><table id=\"kinds\"><tr><th>Kind</th>"
          "<th class=\"n\">Reported</th><th class=\"n\">Not reported</th></tr>\n";
  for (size_t kind = 0; kind < Tally::kKinds.size(); ++kind) {
    html << "<tr><td>" << Tally::kKinds[kind] << "</td><td class=\"n\">"
         << tally.kinds()[kind].reported << "</td><td class=\"n\">"
         << tally.kinds()[kind].unreported << "</td></tr>\n";
  }
  return html << "</table></div>\n</section>\n";
}

Html readingSection(const ExtractionReport& report, const ReportFacts& facts) {
  Html html;
  html << "<section>\n<h2>What was read</h2>\n<p class=\"soft\">" << facts.store
       << "</p>\n"
          "<div class=\"scroll\"><table id=\"reading\">";
  const auto row = [&html](std::string_view what, uint64_t count) {
    html << "<tr><td class=\"name\">" << what << "</td><td class=\"n\">" << count << "</td></tr>\n";
  };
  row("log events", report.entriesRead);
  row("trace points among them", report.assembly.tracePoints);
  const std::pair<std::string_view, uint64_t> rest[] = {
      {"ends whose begin was not read", report.assembly.unmatchedEnds},
      {"begins replaced by a second one", report.assembly.replacedBegins},
      {"begins that wait for their end", report.assembly.openIntervals},
      {"entries that stand in two files", report.store.reading.duplicateEntries},
  };
  for (const auto& [what, count] : rest) {
    if (count != 0) row(what, count);
  }
  return html << "</table></div>\n</section>\n";
}

// Losses of one reading; empty if nothing was lost. The page may show two readings, that of the run
// and ours, so each table has an `id` of its own.
Html lossSection(const StoreReading& reading, std::string_view title, std::string_view id) {
  Html html;
  const std::string part = partOfPeriod(reading);
  const std::string unread = unreadPart(reading);
  if (part.empty() && unread.empty() && reading.losses.empty()) return html;
  html << "<section>\n<h2>" << title << "</h2>\n";
  for (const std::string& sentence : {part, unread})
    if (!sentence.empty()) html << "<p>" << sentence << ".</p>\n";
  html << "<div class=\"scroll\"><table id=\"" << id
       << "\"><tr><th class=\"n\">Lost</th><th>Why</th><th>Where</th></tr>\n";
  for (const Loss& loss : reading.losses.all()) {
    html << "<tr><td class=\"n\">" << loss.count << "</td><td class=\"name\"><code>"
         << lossName(loss.code) << "</code> " << loss.words << "</td><td class=\"name\">"
         << loss.where() << "</td></tr>\n";
  }
  return html << "</table></div>\n</section>\n";
}

Html runSection(const ReportFacts& facts) {
  Html html;
  if (!facts.run) return html;
  const RunRecord& run = *facts.run;
  html << "<section>\n<h2>The run's own books</h2>\n<p class=\"soft\">" << dateText(run.start)
       << ", " << runOutcomeName(run.outcome) << "</p>\n<div class=\"scroll\"><table id=\"run\">";
  const auto row = [&html](std::string_view what, uint64_t count) {
    html << "<tr><td>" << what << "</td><td class=\"n\">" << count << "</td></tr>\n";
  };
  row("trace objects inspected", run.inspected);
  for (const auto verdict : kVerdictOrder) row(title(verdict), run.classified[verdict]);
  row("rows stored in the spool", run.rowsStored);
  html << "</table></div>\n";
  if (run.hasBooks()) {
    const bool balanced = run.objectsBalance() && run.rowsBalance();
    html << "<p>The books "
         << (balanced ? Html() << "<span class=\"good\">balance</span>"
                      : Html() << "<span class=\"bad\">do not balance</span>")
         << ".</p>\n";
  }
  html << "</section>\n";
  if (run.reading) html << lossSection(*run.reading, "What the run lost", "run_losses");
  return html;
}

}  // namespace

std::string htmlReport(const Tally& tally, const ExtractionReport& report,
                       const ReportFacts& facts) {
  Html html;
  html << "<!DOCTYPE html>\n<html lang=\"en\">\n<head>\n<meta charset=\"utf-8\">\n"
       << kPolicy
       << "<meta name=\"viewport\" content=\"width=device-width, initial-scale=1\">\n<title>Trace "
          "points of "
       << facts.machine << ", " << dateText(tally.period().end).substr(0, 10) << "</title>\n<style>"
       << kReportStyle << "</style>\n</head>\n<body>\n<header>\n<h1>Trace points of "
       << facts.machine << "</h1>\n<p>" << dateText(tally.period().start) << " to "
       << dateText(tally.period().end) << " &middot; "
       << (facts.run ? std::string_view("the last run") : std::string_view("a dry run"))
       << ", judged as on " << facts.platform
       << (facts.internal ? std::string_view(" with internal diagnostics") : std::string_view())
       << "</p>\n</header>\n<main>\n"
       << tiles(tally, report) << verdictSection(tally);
  if (tally.traceObjects() != 0)
    html << timeSection(tally) << pairSection(tally) << missSection(tally) << kindSection(tally);
  html << runSection(facts) << readingSection(report, facts)
       << lossSection(report.store.reading, "What was lost", "losses")
       << "</main>\n<footer>Made on " << dateText(facts.made)
       << " by tesselctl, on this machine, for this machine: nothing of it was sent.</footer>\n"
          "</body>\n</html>\n";
  return html.text();
}

}  // namespace tessel::ctl
