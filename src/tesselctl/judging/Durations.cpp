// Counting values in buckets, and finding quantiles among them.
//
// The bits of a float are its exponent and behind it its mantissa. So the exponent with the first
// five bits of the mantissa numbers the buckets: 32 of equal width for each octave, in order of
// value. That takes a shift, where a logarithm would take as long as all other counting of a point.

#include "tesselctl/judging/Durations.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <tuple>

#include "platform/Invariant.h"

namespace tessel::ctl {

namespace {

static_assert(std::numeric_limits<float>::is_iec559 && sizeof(float) == sizeof(uint32_t));
constexpr int kBucketShift = 23 - 5;  // of 23 bits of the mantissa five count

constexpr uint32_t bucketOf(float value) { return std::bit_cast<uint32_t>(value) >> kBucketShift; }
constexpr float bucketStart(uint32_t bucket) {
  return std::bit_cast<float>(bucket << kBucketShift);
}

constexpr uint32_t kFirstBucket = bucketOf(QuantileSketch::kSmallest);
constexpr uint32_t kBuckets = bucketOf(QuantileSketch::kLargest) - kFirstBucket;

// The value of a bucket whose error at both ends of the bucket is the same part of the end: their
// harmonic mean. The middle would be further off at the lower end.
float valueOf(uint32_t bucket) {
  const double from = bucketStart(bucket);
  const double to = bucketStart(bucket + 1);
  return static_cast<float>(2 * from * to / (from + to));
}

}  // namespace

void QuantileSketch::add(float value) {
  static_assert(kBuckets == kOctaves * kStepsOfOctave);
  ++count_;
  minimum_ = std::min(minimum_, value);
  maximum_ = std::max(maximum_, value);
  if (value < kSmallest || value >= kLargest) {
    ++(value < kSmallest ? tiny_ : huge_);
    return;
  }
  const uint32_t bucket = bucketOf(value) - kFirstBucket;
  uint8_t& place = octaveAt_[bucket / kStepsOfOctave];
  if (place == 0) {
    octaves_.emplace_back();
    place = static_cast<uint8_t>(octaves_.size());
  }
  // 32 bits suffice: four billion points of one duration would be a journal of a terabyte.
  ++octaves_[place - 1U][bucket % kStepsOfOctave];
}

float QuantileSketch::atRank(uint64_t rank) const {
  // With the exact ends a single value is shown as it is, and no quantile lies beyond the maximum.
  const auto bounded = [this](float value) { return std::clamp(value, minimum_, maximum_); };
  if (rank == count_) return maximum_;
  uint64_t passed = tiny_;
  if (rank <= passed) return bounded(0);
  for (uint32_t number = 0; number < kOctaves; ++number) {
    const Octave* const counts = octave(number);
    for (uint32_t step = 0; counts != nullptr && step < kStepsOfOctave; ++step) {
      passed += (*counts)[step];
      if (rank <= passed) return bounded(valueOf(kFirstBucket + number * kStepsOfOctave + step));
    }
  }
  TESSEL_INVARIANT(passed + huge_ == count_);  // each value is counted in exactly one place
  return bounded(kLargest);
}

float QuantileSketch::quantile(double part) const {
  const double rank = std::ceil(part * static_cast<double>(count_));
  return atRank(std::clamp<uint64_t>(static_cast<uint64_t>(rank), 1, count_));
}

std::vector<QuantileSketch::Bar> QuantileSketch::histogram() const {
  std::vector<Bar> bars;
  if (tiny_ != 0) bars.push_back({0, kSmallest, tiny_});
  uint32_t first = 0;
  while (first < kOctaves && octave(first) == nullptr) ++first;
  uint32_t end = kOctaves;
  while (end > first && octave(end - 1) == nullptr) --end;
  for (uint32_t number = first; number < end; ++number) {
    const float from = std::ldexp(kSmallest, static_cast<int>(number));
    Bar bar{from, 2 * from, 0};
    if (const Octave* const counts = octave(number); counts != nullptr) {
      for (const uint32_t count : *counts) bar.count += count;
    }
    bars.push_back(bar);
  }
  if (huge_ != 0) bars.push_back({kLargest, std::numeric_limits<float>::max(), huge_});
  return bars;
}

void Durations::count(const TesselObject& object) {
  if (!hasDuration(object)) return;
  countValue(object, Measure::duration, object.durationSeconds());
  if (!object.isKindOf(TesselClass::animationInterval)) return;
  countValue(object, Measure::frameRate,
             static_cast<const TesselAnimationInterval&>(object).frameRate());
}

void Durations::countValue(const TesselObject& object, Measure measure, float value) {
  const Points::Key key{{object.subsystem(), object.category(), object.name()},
                        static_cast<uint8_t>(measure)};
  Values* values = points_.find(key);
  if (values == nullptr) values = addPoint(key);
  if (values == nullptr) {
    ++notListed_[static_cast<size_t>(measure)];
  } else if (value >= 0 && std::isfinite(value)) {
    values->sketch.add(value);
  } else {
    // A clock that was set back, or a writer's mistake. A quantile that took it for a quick point
    // would look better than the machine is.
    ++values->negative;
  }
}

// The counts of a new key; null if there is no room for it.
Durations::Values* Durations::addPoint(const Points::Key& key) {
  size_t bytes = 0;
  for (const StringRef text : key.texts) bytes += text.textOr("").size();
  if (points_.entries().size() >= kMaxListed || textBytes_ + bytes > kMaxTextBytes) return nullptr;
  const decltype(usedByPair_)::Key pair{{key.texts[0], key.texts[1]}};
  Used* used = usedByPair_.find(pair);
  if (used == nullptr) used = &usedByPair_.add(pair);
  if (used->points >= kMaxListed / kShareOfPair ||
      used->bytes + bytes > kMaxTextBytes / kShareOfPair)
    return nullptr;
  ++used->points;
  used->bytes += bytes;
  textBytes_ += bytes;
  return &points_.add(key);
}

void Durations::expect(const Durations& earlier) {
  for (const Points::Entry& entry : earlier.points_.entries()) {
    Points::Key key{{}, entry.slot};
    std::copy(entry.texts.begin(), entry.texts.end(), key.texts.begin());
    const Values* const added = addPoint(key);
    TESSEL_INVARIANT(added !=
                     nullptr);  // both have the same bounds, so what fitted there fits here
  }
}

// Equal counts are ordered by name, so that two reports of one period are the same.
std::vector<Durations::Row> Durations::rows(Measure measure) const {
  std::vector<const Points::Entry*> entries;
  for (const Points::Entry& entry : points_.entries()) {
    if (entry.slot == static_cast<uint8_t>(measure)) entries.push_back(&entry);
  }
  std::sort(entries.begin(), entries.end(), [](const auto* a, const auto* b) {
    const uint64_t countA = a->count.sketch.count();
    const uint64_t countB = b->count.sketch.count();
    if (countA != countB) return countA > countB;
    const auto path = [](const Points::Entry& entry) {
      return std::tuple(entry.texts[0].textOr(""), entry.texts[1].textOr(""),
                        entry.texts[2].present(), entry.texts[2].textOr(""));
    };
    return path(*a) < path(*b);
  });
  std::vector<Row> rows;
  for (const auto* entry : entries) {
    const auto& [texts, slot, values] = *entry;
    rows.push_back({texts[0], texts[1], texts[2], values.sketch, values.negative});
  }
  return rows;
}

namespace {

// What a quantile is likely to be if we had endless values of the same kind.
struct Range {
  float least = 0;
  float most = 0;
};

// The values are a sample, so their quantile is off by chance. With a probability of 99 % the true
// one lies between two ranks that depend on nothing but the number of values: how many fall below
// the quantile is a binomial count, 2.58 of whose standard deviations we allow for. Discarded: a
// fixed least number of values, which is too few for a 95th percentile and too many for a median.
// Absent if one of the ranks is beyond the values, as for a median of fewer than 11.
std::optional<Range> likelyRange(const QuantileSketch& sketch, double part) {
  const auto count = static_cast<double>(sketch.count());
  const double spread = 2.576 * std::sqrt(count * part * (1 - part));
  const double low = std::floor(count * part - spread);
  const double high = std::ceil(count * part + spread + 1);
  if (low < 1 || high > count) return std::nullopt;
  return Range{sketch.atRank(static_cast<uint64_t>(low)),
               sketch.atRank(static_cast<uint64_t>(high))};
}

// A smaller change is not worth a line, and a sketch could not tell one of 3 %.
constexpr double kLeastChange = 1.05;
// The journal's clock counts microseconds. So 2 instead of 0 of them is no change. A frame rate has
// the same bound, which only keeps the division whole.
constexpr float kLeastValue = 1e-6F;

struct QuantileChange {
  double factor = 1;     // how many times slower
  bool known = false;    // there are enough values to tell
  bool certain = false;  // more than chance, and large enough
};

QuantileChange changeOf(const QuantileSketch& a, const QuantileSketch& b, double part,
                        bool lowerIsSlower) {
  const QuantileSketch& slowerIfLess = lowerIsSlower ? b : a;
  const QuantileSketch& slowerIfMore = lowerIsSlower ? a : b;
  const auto value = [&](const QuantileSketch& sketch) {
    return double{std::max(sketch.quantile(part), kLeastValue)};
  };
  QuantileChange change{value(slowerIfMore) / value(slowerIfLess)};
  const auto less = likelyRange(slowerIfLess, part);
  const auto more = likelyRange(slowerIfMore, part);
  change.known = less && more;
  if (change.known) {
    change.certain = (change.factor >= kLeastChange && more->least > less->most) ||
                     (change.factor <= 1 / kLeastChange && more->most < less->least);
  }
  return change;
}

// An operation is slower if either its usual case or its bad case is. People feel both.
void judge(DurationChange& change, Measure measure) {
  using Verdict = DurationChange::Verdict;
  if (change.a->count() == 0 || change.b->count() == 0) {
    change.verdict = change.b->count() == 0 ? Verdict::onlyA : Verdict::onlyB;
    return;
  }
  const bool lowerIsSlower = measure == Measure::frameRate;
  const QuantileChange usual = changeOf(*change.a, *change.b, 0.5, lowerIsSlower);
  const QuantileChange bad =
      changeOf(*change.a, *change.b, lowerIsSlower ? 0.05 : 0.95, lowerIsSlower);
  change.verdict = usual.known ? Verdict::same : Verdict::fewValues;
  change.factor = usual.factor;
  for (const QuantileChange& quantile : {usual, bad}) {
    if (!quantile.certain) continue;
    const bool slower = quantile.factor > 1;
    // Of two changes the greater slowing counts. A speed-up counts only if nothing became slower.
    if (change.verdict == Verdict::slower && quantile.factor < change.factor) continue;
    if (change.verdict == Verdict::faster && !slower) continue;
    change.verdict = slower ? Verdict::slower : Verdict::faster;
    change.factor = quantile.factor;
  }
}

}  // namespace

std::vector<DurationChange> changesBetween(const Durations& a, const Durations& b,
                                           Measure measure) {
  static const QuantileSketch kNoValues;
  std::vector<DurationChange> changes;
  for (const auto& [texts, slot, values] : b.points_.entries()) {
    if (slot != static_cast<uint8_t>(measure)) continue;
    const Durations::Values* before = a.points_.find({{texts[0], texts[1], texts[2]}, slot});
    DurationChange change{texts[0], texts[1], texts[2],
                          before != nullptr ? &before->sketch : &kNoValues, &values.sketch};
    if (change.a->count() + change.b->count() == 0) continue;  // negative values alone
    judge(change, measure);
    changes.push_back(change);
  }
  // Equal ones are ordered by name, so that two comparisons of the same periods are the same.
  std::sort(changes.begin(), changes.end(), [](const DurationChange& x, const DurationChange& y) {
    if (x.verdict != y.verdict) return x.verdict < y.verdict;
    if (x.factor != y.factor) return x.factor > y.factor;
    const auto path = [](const DurationChange& change) {
      return std::tuple(change.subsystem.textOr(""), change.category.textOr(""),
                        change.name.present(), change.name.textOr(""));
    };
    return path(x) < path(y);
  });
  return changes;
}

}  // namespace tessel::ctl
