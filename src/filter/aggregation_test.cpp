// Counting by (subsystem, category), its key equality and what it costs.

#include "filter/TesselReporterAggregation.h"

#include <gtest/gtest.h>

#include <map>
#include <random>

namespace tessel {
namespace {

using Key = TesselReporterAggregationKey;

Key key(const char* subsystem, const char* category) {
  return {subsystem ? SharedString(subsystem) : SharedString(),
          category ? SharedString(category) : SharedString()};
}

void increment(TesselReporterAggregation& aggregation, const char* subsystem,
               const char* category) {
  // Each call makes new strings, as each extraction does.
  const Key own = key(subsystem, category);
  aggregation.incrementSubsystem(own.subsystem(), own.category());
}

uint64_t count(const TesselReporterAggregation& aggregation, const char* subsystem,
               const char* category) {
  const Key own = key(subsystem, category);
  return aggregation.countForSubsystem(own.subsystem(), own.category());
}

std::vector<std::string> descriptions(const TesselReporterAggregation& aggregation) {
  std::vector<std::string> texts;
  for (const auto* each : aggregation.keysInDescendingCountOrder()) {
    texts.push_back(each->description() + " " + std::to_string(aggregation.countForKey(*each)));
  }
  return texts;
}

TEST(AggregationKeyTest, KeysWithAbsentStringsDiffer) {
  const struct {
    Key a, b;
    bool equal;
  } cases[] = {{key("s", "c"), key("s", "c"), true},
               {key("s", "c"), key("s", "d"), false},
               {key("s", "c"), key("t", "c"), false},
               {key("s", "c"), key("S", "c"), false},
               {key("s", "c"), key("c", "s"), false},
               {key(nullptr, "c"), key(nullptr, "c"), false},
               {key("s", nullptr), key("s", nullptr), false},
               {key(nullptr, nullptr), key(nullptr, nullptr), false},
               {key("s", "c"), key(nullptr, "c"), false}};
  for (const auto& row : cases) {
    EXPECT_EQ(row.a.isEqual(row.b), row.equal) << row.a.description() << row.b.description();
    EXPECT_EQ(row.b.isEqual(row.a), row.equal);
    EXPECT_TRUE(row.a.isEqual(row.a));
    if (row.equal) {
      EXPECT_EQ(row.a.hash(), row.b.hash());
    }
  }
  EXPECT_EQ(key("s", nullptr).hash(), SharedString("s").hash());
  EXPECT_EQ(key(nullptr, "s").description(), "(null)/s");
}

TEST(AggregationTest, OrdersByCountThenByFirstAppearance) {
  TesselReporterAggregation aggregation;
  EXPECT_EQ(count(aggregation, "a", "x"), 0u);
  EXPECT_TRUE(aggregation.keysInDescendingCountOrder().empty());
  for (const char* subsystem : {"b", "a", "z", "a", "c", "a", "c", "y"}) {
    increment(aggregation, subsystem, "x");
  }
  EXPECT_EQ(descriptions(aggregation),
            (std::vector<std::string>{"a/x 3", "c/x 2", "b/x 1", "z/x 1", "y/x 1"}));
  EXPECT_EQ(aggregation.totalCount(), 8u);
  EXPECT_EQ(count(aggregation, "x", "a"), 0u);
  // Any key that is equal finds the count.
  EXPECT_EQ(aggregation.countForKey(key("a", "x")), 3u);
  EXPECT_EQ(aggregation.countForKey(key("x", "a")), 0u);
}

TEST(AggregationTest, AnAbsentStringMakesANewEntry) {
  TesselReporterAggregation aggregation;
  increment(aggregation, "s", "c");
  for (int i = 0; i < 2; ++i) {
    increment(aggregation, nullptr, "c");
    increment(aggregation, "s", nullptr);
    increment(aggregation, nullptr, nullptr);
  }
  increment(aggregation, "s", "c");
  EXPECT_EQ(aggregation.totalCount(), 8u);
  EXPECT_EQ(count(aggregation, nullptr, "c"), 0u);
  EXPECT_EQ(count(aggregation, "s", nullptr), 0u);

  const auto keys = aggregation.keysInDescendingCountOrder();
  ASSERT_EQ(keys.size(), 7u);
  EXPECT_EQ(aggregation.countForKey(*keys[0]), 2u);
  // Its own keys have their counts; a copy of one with an absent string equals none of them.
  for (size_t i = 1; i < keys.size(); ++i) {
    EXPECT_EQ(aggregation.countForKey(*keys[i]), 1u);
    EXPECT_EQ(aggregation.countForKey(Key(*keys[i])), 0u);
  }
}

TEST(AggregationTest, AbsentStringsDoNotCrowdTheOthers) {
  TesselReporterAggregation aggregation;
  for (int i = 0; i < 200; ++i) increment(aggregation, nullptr, "c");
  for (int i = 0; i < 40; ++i) increment(aggregation, "s", std::to_string(i % 20).c_str());
  EXPECT_EQ(count(aggregation, "s", "0"), 2u);
  EXPECT_EQ(count(aggregation, "s", "19"), 2u);
  EXPECT_EQ(aggregation.aggregationDictionary().size(), 220u);
}

TEST(AggregationTest, KeepsItsStringsAlive) {
  TesselReporterAggregation aggregation;
  {
    StringPool pool;
    aggregation.incrementSubsystem(pool.intern("subsystem"), pool.intern("category"));
  }
  EXPECT_EQ(descriptions(aggregation), std::vector<std::string>{"subsystem/category 1"});
}

TEST(AggregationTest, CountsAsAPlainMapDoes) {
  // Some pairs have two equal strings. An exclusive or would give all of these the same hash.
  std::mt19937 random(7);
  StringPool pool;
  TesselReporterAggregation aggregation;
  std::map<std::pair<std::string, std::string>, uint64_t> expected;
  for (int i = 0; i < 20000; ++i) {
    const std::string subsystem = std::to_string(random() % 60);
    const std::string category = std::to_string(random() % 60);
    if (random() % 16 == 0) increment(aggregation, nullptr, category.c_str());
    aggregation.incrementSubsystem(pool.intern(subsystem), pool.intern(category));
    ++expected[{subsystem, category}];
  }
  uint64_t sum = 0;
  for (const auto& [pair, times] : expected) {
    EXPECT_EQ(count(aggregation, pair.first.c_str(), pair.second.c_str()), times);
  }
  uint64_t previous = UINT64_MAX;
  for (const auto* each : aggregation.keysInDescendingCountOrder()) {
    const uint64_t now = aggregation.countForKey(*each);
    EXPECT_LE(now, previous);
    previous = now;
    sum += now;
  }
  EXPECT_EQ(sum, aggregation.totalCount());
}

}  // namespace
}  // namespace tessel
