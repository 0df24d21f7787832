// Durations: how long trace points took and how fast animations ran, as quantiles.
//
// A day may hold millions of durations. Sorting them for a percentile would keep them all in
// memory. So we count them in buckets. A bucket is 1/32 of an octave wide, so buckets grow with the
// durations, and the error is relative: 1.6 % at most, for microseconds as for hours. The price is
// 128 bytes for each octave that a trace point meets. Discarded: a sample, which misses the rare
// slow point that people look for, and buckets of equal width, which are too coarse for one trace
// point and too many for the next.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <cstdint>
#include <limits>
#include <string>
#include <string_view>
#include <vector>

#include "objects/TesselObject.h"
#include "tesselctl/judging/KeyedCounts.h"

namespace tessel::ctl {

// Counts values and answers their quantiles. Memory: 128 bytes for each octave in use, at most 8
// KiB; none before the first value.
class QuantileSketch {
 public:
  // A quantile between the two bounds is wrong by at most this part of the true one. Below
  // kSmallest it is wrong by at most kSmallest. From kLargest on, which is two years, we only
  // promise that it lies between kLargest and maximum().
  static constexpr double kError = 1.0 / 65;
  static constexpr float kSmallest = 0x1p-30F;  // a nanosecond
  static constexpr float kLargest = 0x1p26F;

  // REQUIRES: value is a number and not negative.
  void add(float value);

  uint64_t count() const { return count_; }
  // Both are exact. REQUIRES: count() > 0.
  float minimum() const { return minimum_; }
  float maximum() const { return maximum_; }
  // The value that stands at `rank` if all are sorted; 1 is the least. REQUIRES: 1 <= rank <=
  // count().
  float atRank(uint64_t rank) const;
  // The value that `part` of all values do not exceed: 0.95 for p95. REQUIRES: count() > 0, and 0 <
  // part <= 1.
  float quantile(double part) const;

  // Values from `from` up to but without `to`.
  struct Bar {
    float from = 0;
    float to = 0;
    uint64_t count = 0;
  };
  // A histogram: the least to the greatest value in steps of a factor of two, without gaps. Values
  // below kSmallest share one bar before all others, and values from kLargest on one behind them.
  std::vector<Bar> histogram() const;

 private:
  static constexpr uint32_t kStepsOfOctave = 32;
  static constexpr uint32_t kOctaves = 56;  // from kSmallest to kLargest
  using Octave = std::array<uint32_t, kStepsOfOctave>;

  const Octave* octave(size_t number) const {
    return octaveAt_[number] == 0 ? nullptr : &octaves_[octaveAt_[number] - 1U];
  }

  uint64_t count_ = 0;
  uint64_t tiny_ = 0;  // values below kSmallest, zero among them
  uint64_t huge_ = 0;  // values from kLargest on
  float minimum_ = std::numeric_limits<float>::infinity();
  float maximum_ = 0;
  std::array<uint8_t, kOctaves> octaveAt_{};  // its place in octaves_, from 1 on; 0: none yet
  std::vector<Octave> octaves_;
};

struct DurationChange;

// What a sketch is of.
enum class Measure : uint8_t { duration, frameRate };

// Whether the duration of an object means anything: an interval has one, and an event that states
// one.
inline bool hasDuration(const TesselObject& object) {
  return object.statesDuration() || object.isKindOf(TesselClass::interval);
}

// Durations and frame rates by trace point.
class Durations {
 public:
  // A program that puts numbers into its names makes trace points without end. Together these
  // bounds keep all sketches within 36 MiB; an ordinary day takes a few hundred KiB. A pair of
  // subsystem and category has an eighth of each at most, so that one that floods leaves room for
  // others.
  static constexpr size_t kMaxListed = 4096;
  static constexpr size_t kMaxTextBytes = size_t{2} << 20;  // of subsystems, categories and names
  static constexpr size_t kShareOfPair = 8;

  // Counts the duration of an object that has one, and the frame rate of an animation interval.
  // Other objects cost two comparisons and no memory.
  void count(const TesselObject& object);

  // Makes room for the trace points of an earlier period. Without it a flood in this period could
  // take their room, and they would seem to be gone. REQUIRES: nothing was counted yet.
  void expect(const Durations& earlier);

  // The values of one trace point. Borrowed; valid until the next count().
  struct Row {
    StringRef subsystem;
    StringRef category;
    StringRef name;  // may be absent
    const QuantileSketch& sketch;
    uint64_t negative = 0;  // values below zero, which the sketch leaves out
  };
  // Most values first. A trace point that was only expected has no values.
  std::vector<Row> rows(Measure measure) const;
  // Values of trace points that rows() has no room for.
  uint64_t notListed(Measure measure) const { return notListed_[static_cast<size_t>(measure)]; }

 private:
  friend std::vector<DurationChange> changesBetween(const Durations&, const Durations&, Measure);
  struct Values {
    QuantileSketch sketch;
    uint64_t negative = 0;
  };
  struct Used {
    size_t points = 0;
    size_t bytes = 0;
  };
  using Points = KeyedCounts<3, Values>;

  void countValue(const TesselObject& object, Measure measure, float value);
  Values* addPoint(const Points::Key& key);

  Points points_;  // the slot of a key is its measure
  KeyedCounts<2, Used> usedByPair_;
  size_t textBytes_ = 0;
  uint64_t notListed_[2] = {};
};

// What became of one trace point from a period A to a later one, B.
struct DurationChange {
  enum class Verdict : uint8_t {
    slower,     // by more than chance makes likely, and by 5 % or more
    same,       // neither slower nor faster
    faster,     // as slower, in the other direction
    fewValues,  // of one period, too few to tell
    onlyA,      // no values in the other period
    onlyB,
  };
  StringRef subsystem;
  StringRef category;
  StringRef name;                     // may be absent
  const QuantileSketch* a = nullptr;  // never null; borrowed, as the texts
  const QuantileSketch* b = nullptr;
  Verdict verdict = Verdict::same;
  double factor = 1;  // how many times slower B is; below 1 it is faster. 1 for onlyA and onlyB
};

// In the order of Verdict, and within a verdict what became slowest first. Of a frame rate, slower
// is lower. REQUIRES: `b` was made to expect `a`.
std::vector<DurationChange> changesBetween(const Durations& a, const Durations& b, Measure measure);

}  // namespace tessel::ctl
