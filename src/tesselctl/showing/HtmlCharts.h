// The charts of the report page, as SVG that the page holds itself.
//
// A chart shows its figures as the title of the part under the pointer, and says them to those who
// cannot see it. Stateless.

#pragma once

#include <limits>
#include <string>

#include "tesselctl/judging/Tally.h"
#include "tesselctl/showing/Html.h"

namespace tessel::ctl {

// "12.5 %". A count that is not zero is never shown as "0.0 %": a reader would take it for none.
std::string percent(uint64_t part, uint64_t whole);

// The words for a verdict, with a capital letter for the heading of a row or column.
std::string verdictTitle(TesselReporterClassification verdict);

// All verdicts as the parts of one bar, which is as long for 2 objects as for 2 million.
enum class BarSize { row, page };
Html verdictBar(const VerdictCounts& counts, BarSize size);

// The colour of each verdict that occurs.
Html legend(const VerdictCounts& counts);

// Columns over time, and the table with the same figures.
Html timeChart(const Tally& tally);

// The name of a slice of the tally's period: when it begins.
std::string sliceName(const Tally& tally, size_t slice);

// Histograms of several sketches above one axis, so that people can compare them. A step of the
// axis is a factor of two. REQUIRES: each sketch that is used here has a value.
class Histograms {
 public:
  void include(const QuantileSketch& sketch);
  // REQUIRES: the sketch was included. `shown` writes a value for people.
  Html html(const QuantileSketch& sketch, std::string (*shown)(float)) const;
  // Where the axis begins and ends: "1 ms to 4 s". REQUIRES: a sketch was included.
  std::string range(std::string (*shown)(float)) const;

 private:
  // The exponents of two where the axis begins, and where its last step begins.
  int first_ = std::numeric_limits<int>::max();
  int last_ = std::numeric_limits<int>::min();
};

}  // namespace tessel::ctl
