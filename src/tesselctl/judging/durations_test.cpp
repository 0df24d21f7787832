// Quantiles from buckets against the sorted values themselves.

#include "tesselctl/judging/Durations.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <functional>
#include <random>

#include <gtest/gtest.h>

namespace tessel::ctl {
namespace {

using Random = std::mt19937_64;
constexpr float kHuge = std::numeric_limits<float>::max();

// The rules of the header for one quantile.
void expectWithinError(float estimate, float exact) {
  if (exact < QuantileSketch::kSmallest) {
    EXPECT_NEAR(estimate, exact, QuantileSketch::kSmallest);
  } else if (exact >= QuantileSketch::kLargest) {
    EXPECT_GE(estimate, QuantileSketch::kLargest);
  } else {
    EXPECT_NEAR(estimate, exact, exact * QuantileSketch::kError * 1.0001);  // a float rounds, too
  }
}

TEST(QuantileSketchTest, QuantilesAreThoseOfSortedValues) {
  Random random(20);
  const std::function<double()> kinds[] = {
      [&] { return std::lognormal_distribution<>(-5, 3)(random); },
      [&] { return std::exponential_distribution<>(100)(random); },
      [&] { return std::uniform_real_distribution<>(0, 1)(random) < 0.95 ? 0.001 : 30.0; },
      [&] { return std::ldexp(1 + 1 / 32.0, static_cast<int>(random() % 80) - 40); },
      // Any float at all: the bits of one, without its sign.
      [&] { return std::bit_cast<float>(static_cast<uint32_t>(random() % 0x7f800000)); }};
  for (const auto& draw : kinds) {
    for (const size_t count : {1u, 2u, 3u, 7u, 100u, 20'000u}) {
      QuantileSketch sketch;
      std::vector<float> values(count);
      for (float& value : values) sketch.add(value = static_cast<float>(draw()));
      std::sort(values.begin(), values.end());
      ASSERT_EQ(sketch.count(), count);
      EXPECT_EQ(sketch.minimum(), values.front());
      EXPECT_EQ(sketch.maximum(), values.back());
      for (size_t rank = 1; rank <= count; rank += 1 + count / 100)
        expectWithinError(sketch.atRank(rank), values[rank - 1]);
      for (const size_t percent : {1u, 5u, 50u, 95u, 99u, 100u}) {
        const size_t rank =
            std::max<size_t>((percent * count + 99) / 100, 1);  // ceil() in integers
        EXPECT_EQ(sketch.quantile(static_cast<double>(percent) / 100), sketch.atRank(rank));
      }
      // Each bar has the values between its ends, and bars follow one another.
      float end = 0;
      uint64_t inBars = 0;
      for (const auto& bar : sketch.histogram()) {
        const auto least = std::lower_bound(values.begin(), values.end(), bar.from);
        const auto behind =
            bar.to == kHuge ? values.end() : std::lower_bound(values.begin(), values.end(), bar.to);
        EXPECT_EQ(bar.count, static_cast<uint64_t>(behind - least));
        if (end > QuantileSketch::kSmallest && bar.from != QuantileSketch::kLargest) {
          EXPECT_EQ(bar.from, end);
        }
        end = bar.to;
        inBars += bar.count;
      }
      EXPECT_EQ(inBars, count);
    }
  }
}

std::shared_ptr<const TesselObject> interval(StringPool& pool, const std::string& category,
                                             const std::string& name, float seconds) {
  TracePointFields fields;
  fields.subsystem = pool.intern("com.vantor.Flood");
  fields.category = pool.intern(category);
  fields.name = pool.intern(name);
  fields.durationSeconds = seconds;
  return std::make_shared<const TesselInterval>(fields, IntervalFields{});
}

TEST(DurationsTest, AFloodOfNamesIsCountedAndLeavesRoom) {
  StringPool pool;
  Durations durations;
  for (int i = 0; i < 29'000; ++i)
    durations.count(*interval(pool, "Hostile", "N" + std::to_string(i), 1));
  // Of names of 4,096 bytes the bound of bytes leaves fewer.
  for (int i = 0; i < 600; ++i)
    durations.count(*interval(pool, "Long", std::string(4092, 'x') + std::to_string(1000 + i), 2));
  for (int i = 0; i < 29'000; ++i)
    durations.count(*interval(pool, "C" + std::to_string(i), "Late", 3));
  for (const float seconds :
       {4.0F, -1.0F, -kHuge, std::nanf(""), std::numeric_limits<float>::infinity()})
    durations.count(*interval(pool, "Hostile", "N7", seconds));
  const auto rows = durations.rows(Measure::duration);
  uint64_t counted = durations.notListed(Measure::duration);
  size_t bytes = 0;
  for (const auto& row : rows) {
    counted += row.sketch.count() + row.negative;
    bytes += row.subsystem.text().size() + row.category.text().size() + row.name.text().size();
  }
  EXPECT_EQ(counted, 58'605u);
  EXPECT_LE(rows.size(), Durations::kMaxListed);
  EXPECT_LE(bytes, Durations::kMaxTextBytes);
  EXPECT_EQ(std::ranges::count_if(rows, [](auto& row) { return row.category.text() == "Hostile"; }),
            Durations::kMaxListed / Durations::kShareOfPair);
  EXPECT_GT(std::ranges::count_if(rows, [](auto& row) { return row.name.text() == "Late"; }), 3000);
  // The most frequent comes first, with what is no duration beside its quantiles.
  EXPECT_EQ(rows.front().name.text(), "N7");
  EXPECT_EQ(rows.front().sketch.count(), 2u);
  EXPECT_EQ(rows.front().sketch.maximum(), 4.0F);
  EXPECT_EQ(rows.front().negative, 4u);
}

}  // namespace
}  // namespace tessel::ctl
