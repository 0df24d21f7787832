// Drawing the charts.
//
// The page holds finished drawings, so its charts need no script: the page is whole in a browser
// that runs none. The price: a chart cannot be zoomed.
//
// Two colours that touch must differ by more than their hue. Six colours cannot all contrast with
// each other, and any two verdicts may be neighbours where those between them are absent. So parts
// never touch: a gap in the colour of the page is between them, and each colour contrasts with
// that.

#include "tesselctl/showing/HtmlCharts.h"

#include <algorithm>
#include <cctype>
#include <cmath>
#include <vector>

namespace tessel::ctl {

namespace {

// Drawings have units of their own and are stretched to the room that the page gives them.
constexpr double kWidth = 1000;
constexpr double kHeight = 200;

double ratio(uint64_t part, uint64_t whole) {
  return whole == 0 ? 0 : static_cast<double>(part) / static_cast<double>(whole);
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

struct Part {
  TesselReporterClassification verdict;
  double begin;
  double length;
};

// `length` divided among the verdicts that occur. Each has at least `least`, because one lost
// object in a million is what people look for. The rest is shared by count, so the parts are a
// little more equal than the counts are. If `length` is too short for that, the parts are longer
// together.
std::vector<Part> divided(const VerdictCounts& counts, double length, double gap, double least) {
  const uint64_t total = sumOf(counts);
  const auto used =
      static_cast<double>(std::ranges::count_if(counts, [](uint64_t count) { return count != 0; }));
  const double shared = std::max(0.0, length - used * least - (used - 1) * gap);
  std::vector<Part> parts;
  double begin = 0;
  for (const auto verdict : kVerdictOrder) {
    if (counts[verdict] == 0) continue;
    parts.push_back({verdict, begin, least + ratio(counts[verdict], total) * shared});
    begin += parts.back().length + gap;
  }
  return parts;
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

// A drawing counts y from the top down, so a column starts at the bottom and each part moves up.
// The room between columns is 24 % of a step.
Html columns(const Tally& tally, uint64_t top) {
  constexpr double kGap = 1.5;
  constexpr double kLeast = 2;
  Html html;
  const double step = kWidth / static_cast<double>(tally.slices().size());
  for (size_t slice = 0; slice < tally.slices().size(); ++slice) {
    const VerdictCounts& counts = tally.slices()[slice];
    if (sumOf(counts) == 0) continue;
    html << "<g><title>" << sliceName(tally, slice) << ": " << spoken(counts) << "</title>";
    for (const Part& part : divided(counts, ratio(sumOf(counts), top) * kHeight, kGap, kLeast)) {
      html << "<rect class=\"" << verdictName(part.verdict) << "\" x=\"";
      html.at(static_cast<double>(slice) * step + step * 0.12) << "\" y=\"";
      html.at(kHeight - part.begin - part.length) << "\" width=\"";
      html.at(step * 0.76) << "\" height=\"";
      html.at(part.length) << "\"/>";
    }
    html << "</g>\n";
  }
  return html;
}

Html sliceTable(const Tally& tally) {
  Html html;
  html << "<details><summary>The same as a table</summary>\n<div class=\"scroll\" tabindex=\"0\" "
          "role=\"region\" aria-label=\"Trace objects over time\">\n<table id=\"slices\"><caption>"
          "Trace objects by verdict; times without any are left out</caption>\n<thead><tr><th "
          "scope=\"col\">From</th>";
  for (const auto verdict : kVerdictOrder)
    html << "<th scope=\"col\" class=\"n\">" << verdictTitle(verdict) << "</th>";
  html << "</tr></thead>\n<tbody>\n";
  for (size_t slice = 0; slice < tally.slices().size(); ++slice) {
    // A quiet week would fill the table with rows of zeros.
    if (sumOf(tally.slices()[slice]) == 0) continue;
    html << "<tr><th scope=\"row\">" << sliceName(tally, slice) << "</th>";
    for (const auto verdict : kVerdictOrder)
      html << "<td class=\"n\">" << tally.slices()[slice][verdict] << "</td>";
    html << "</tr>\n";
  }
  return html << tableEnd() << "</div></details>\n";
}

// The exponent of two where a bar begins. The bar of values below the least one begins at zero,
// which has no exponent, so it stands one step before its end.
int stepOf(const QuantileSketch::Bar& bar) {
  return bar.from > 0 ? std::ilogb(bar.from) : std::ilogb(bar.to) - 1;
}

}  // namespace

std::string percent(uint64_t part, uint64_t whole) {
  if (whole == 0) return "0 %";
  const double share = ratio(part, whole) * 100;
  if (part != 0 && share < 0.1) return "< 0.1 %";
  const auto tenths = static_cast<uint64_t>(std::llround(share * 10));
  return std::to_string(tenths / 10) + "." + std::to_string(tenths % 10) + " %";
}

std::string verdictTitle(TesselReporterClassification verdict) {
  std::string words(classificationRow(verdict).title);
  words[0] = static_cast<char>(std::toupper(words[0]));
  return words;
}

// The classes are verdict names: the style has a colour for each, which is checked when it is
// compiled. A bar in a row is a third as wide as the page, so its gap is three times as wide.
Html verdictBar(const VerdictCounts& counts, BarSize size) {
  const double gap = size == BarSize::row ? 8 : 2.5;
  const double least = size == BarSize::row ? 14 : 5;
  Html html;
  html << "<svg class=\"" << (size == BarSize::row ? std::string_view("row") : "page")
       << "\" viewBox=\"0 0 1000 10\" preserveAspectRatio=\"none\" role=\"img\"><title>"
       << spoken(counts) << "</title>";
  for (const Part& part : divided(counts, kWidth, gap, least)) {
    html << "<rect class=\"" << verdictName(part.verdict) << "\" x=\"";
    html.at(part.begin) << "\" width=\"";
    html.at(part.length) << "\" height=\"10\"/>";
  }
  return html << "</svg>";
}

Html legend(const VerdictCounts& counts) {
  Html html;
  html << "<ul class=\"legend\">";
  for (const auto verdict : kVerdictOrder) {
    if (counts[verdict] == 0) continue;
    html << "<li><span class=\"key " << verdictName(verdict) << "\"></span>"
         << verdictTitle(verdict) << "</li>";
  }
  return html << "</ul>\n";
}

std::string sliceName(const Tally& tally, size_t slice) {
  const std::string date = dateText(tally.sliceStart(slice));
  const bool wholeDays = tally.sliceLength() >= std::chrono::hours{24};
  // Behind the seconds a zone may stand, which tells the two rounds of a repeated hour apart.
  return wholeDays ? date.substr(0, 10) : date.substr(5, 11) + date.substr(19);
}

Html timeChart(const Tally& tally) {
  uint64_t highest = 0;
  size_t busiest = 0;
  for (size_t slice = 0; slice < tally.slices().size(); ++slice) {
    if (sumOf(tally.slices()[slice]) <= highest) continue;
    highest = sumOf(tally.slices()[slice]);
    busiest = slice;
  }
  const uint64_t top = roundTop(highest);
  Html html;
  html << "<div class=\"chart\"><div class=\"ticks\" aria-hidden=\"true\"><span>" << grouped(top)
       << "</span><span>" << (top % 2 == 0 ? grouped(top / 2) : std::string())
       << "</span><span>0</span></div>\n<svg viewBox=\"0 0 1000 200\" preserveAspectRatio=\"none\" "
          "role=\"img\" aria-label=\"Trace objects over time; most, "
       << grouped(highest) << ", from " << sliceName(tally, busiest)
       << ". The table below has all figures.\">\n"
          "<path class=\"grid\" d=\"M0 0H1000M0 100H1000M0 200H1000\"/>\n"
       << columns(tally, top) << "</svg>\n<div class=\"times\" aria-hidden=\"true\">";
  const size_t last = tally.slices().size() - 1;
  for (const size_t slice : {size_t{0}, last / 2, last}) {
    if (slice == 0 || last > 1) html << "<span>" << sliceName(tally, slice) << "</span>";
  }
  return html << "</div></div>\n" << legend(tally.verdicts()) << sliceTable(tally);
}

void Histograms::include(const QuantileSketch& sketch) {
  const auto bars = sketch.histogram();
  first_ = std::min(first_, stepOf(bars.front()));
  last_ = std::max(last_, stepOf(bars.back()));
}

std::string Histograms::range(std::string (*shown)(float)) const {
  return shown(std::ldexp(1.0F, first_)) + " to " + shown(std::ldexp(1.0F, last_ + 1));
}

// A bar that is not empty is never flat: the one slow point of a day is what people look for.
Html Histograms::html(const QuantileSketch& sketch, std::string (*shown)(float)) const {
  constexpr double kFlattest = 0.08;
  const auto bars = sketch.histogram();
  const auto most = std::ranges::max_element(bars, {}, &QuantileSketch::Bar::count);
  const double step = kWidth / (last_ - first_ + 1);
  Html html;
  html << "<svg class=\"row spread\" viewBox=\"0 0 1000 200\" preserveAspectRatio=\"none\" "
          "role=\"img\"><title>From "
       << shown(sketch.minimum()) << " to " << shown(sketch.maximum()) << "; most, "
       << grouped(most->count) << ", from " << shown(most->from) << " to " << shown(most->to)
       << "</title><path d=\"";
  for (const QuantileSketch::Bar& bar : bars) {
    if (bar.count == 0) continue;
    const double height = std::max(kFlattest, ratio(bar.count, most->count)) * kHeight;
    html << "M";
    html.at((stepOf(bar) - first_) * step) << " 200v-";
    html.at(height) << "h";
    html.at(step * 0.86) << "v";
    html.at(height) << "z";
  }
  return html << "\"/></svg>";
}

}  // namespace tessel::ctl
