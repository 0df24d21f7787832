// The decision about an object, its explanation and its counting.

#include "filter/TesselReporterObjectFilter.h"

#include <gtest/gtest.h>

#include <cmath>
#include <functional>
#include <limits>
#include <random>
#include <set>

#include "objects/testing/TestObjects.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using testing::FakeBuildVariant;
using testing::makeAnimationInterval;
using testing::makeEvent;
using testing::makeInterval;
using testing::makeObject;
using testing::TestPoint;
using Platform = TesselReporterPlatform;

// What can be wrong with an object, in the order in which it is checked.
enum Fault { kClass, kTelemetry, kDuration, kString, kDownsampling };

constexpr TesselReporterClassification kClassificationOfFault[] = {
    TesselReporterClassificationClassNotSupported, TesselReporterClassificationTelemetryDisabled,
    TesselReporterClassificationDurationThreshold,
    TesselReporterClassificationFailedStringWhitelist, TesselReporterClassificationFailedSCFilter};

// An object with these faults and no other, for a filter with the Selvin downsampling.
std::shared_ptr<const TesselObject> faultyObject(const std::set<Fault>& faults) {
  TestPoint point;
  if (faults.contains(kTelemetry)) point.telemetryEnabled = false;
  if (faults.contains(kDuration)) point.durationSeconds = -0.001F;
  point.strings[0] = {"period", faults.contains(kString) ? "weekly" : "week"};
  if (faults.contains(kDownsampling)) {
    point.subsystem = "com.vantor.quellan.knowledge";
    point.category = "tessel";
    point.name = "Footprint";
  }
  if (faults.contains(kClass)) return makeObject(point);
  return makeEvent(point);
}

class ObjectFilterTest : public ::testing::Test {
 protected:
  std::shared_ptr<TesselReporterObjectFilter> makeFilter(Platform platform) {
    auto made = TesselReporterObjectFilter::initWithPlatform(platform, variant);
    made->setScnFilter(makeDefaultFilterForPlatform(platform));
    return made;
  }
  TesselReporterClassification classify(const TesselSupportObject& object) {
    return filter->inspectTesselObject(object).classification;
  }

  FakeBuildVariant variant;
  std::shared_ptr<TesselReporterObjectFilter> filter = makeFilter(Platform::selvin);
};

TEST_F(ObjectFilterTest, TheFirstFailingCheckDecides) {
  EXPECT_EQ(classify(*faultyObject({})), TesselReporterClassificationTelemetryReported);
  for (const Fault first : {kClass, kTelemetry, kDuration, kString, kDownsampling}) {
    for (const Fault second : {kClass, kTelemetry, kDuration, kString, kDownsampling}) {
      if (second < first) continue;
      SCOPED_TRACE("faults " + std::to_string(first) + " and " + std::to_string(second));
      const auto object = faultyObject({first, second});
      auto classification = TesselReporterClassificationTelemetryReported;
      EXPECT_FALSE(filter->shouldReportTesselObject(*object, &classification));
      EXPECT_EQ(classification, kClassificationOfFault[first]);
    }
  }
}

TEST_F(ObjectFilterTest, WhatIsNoTracePointIsNotSupported) {
  const TesselSupportObject object;
  EXPECT_EQ(classify(object), TesselReporterClassificationClassNotSupported);
  EXPECT_EQ(filter->allInspectedTesselObjectsAggregation().totalCount(), 1u);
  EXPECT_EQ(filter->totalUnreportedEventCount(), 0u);
}

TEST_F(ObjectFilterTest, OnlyADurationBelowZeroIsTooShort) {
  const struct {
    float seconds;
    bool reported;
  } cases[] = {{0.0F, true},
               {-0.0F, true},
               {-0.001F, false},
               {-std::numeric_limits<float>::denorm_min(), false},
               {std::numeric_limits<float>::quiet_NaN(), true},
               {-std::numeric_limits<float>::infinity(), false},
               {1.5F, true}};
  for (const auto& row : cases) {
    TestPoint point;
    point.durationSeconds = row.seconds;
    EXPECT_EQ(filter->shouldReportTesselObject(*makeEvent(point), nullptr), row.reported)
        << row.seconds;
  }
}

TEST_F(ObjectFilterTest, DownsamplingIsAskedLast) {
  const auto held = faultyObject({kDownsampling});
  const auto* entry = filter->scnFilter()->downsampleEntryForObject(*held);
  for (const Fault fault : {kClass, kTelemetry, kDuration, kString}) {
    classify(*faultyObject({fault, kDownsampling}));
  }
  EXPECT_EQ(entry->eventsSeen(), 0u);
  classify(*held);
  EXPECT_EQ(entry->eventsSeen(), 1u);

  filter->setScnFilter(nullptr);
  EXPECT_EQ(classify(*held), TesselReporterClassificationTelemetryReported);
}

TEST_F(ObjectFilterTest, ADecisionNamesWhatDecided) {
  TestPoint point;
  point.strings = {{{"period", {}}, {"size", "huge"}}};
  for (const int slot : {1, 2}) {
    const auto object = makeEvent(point);
    const FilterDecision decision = filter->inspectTesselObject(*object);
    EXPECT_EQ(decision.stringSlot, slot);
    EXPECT_EQ(decision.stringLabel.textOr(""), slot == 1 ? "period" : "size");
    EXPECT_EQ(decision.stringValue.textOr("absent"), slot == 1 ? "absent" : "huge");
    EXPECT_FALSE(decision.specialRule);
    point.strings[0].second = "week";
  }
  const FilterDecision tooShort = filter->inspectTesselObject(*faultyObject({kDuration}));
  EXPECT_EQ(tooShort.durationSeconds, -0.001F);
  EXPECT_EQ(tooShort.stringSlot, 0);
  EXPECT_EQ(tooShort.downsampleEntry, nullptr);
  const FilterDecision held = filter->inspectTesselObject(*faultyObject({kDownsampling}));
  ASSERT_NE(held.downsampleEntry, nullptr);
  EXPECT_EQ(held.downsampleEntry->cap(), 0u);
  EXPECT_EQ(held.downsampleEntry->eventsSeen(), 1u);
}

TestPoint perfLoggingPoint(TestPoint::Text component, TestPoint::Text action) {
  TestPoint point;
  point.subsystem = "com.vantor.PerformanceAnalysis";
  point.category = "PerfLogging";
  point.name = "PerfLoggingOperation";
  point.strings = {{{{}, std::move(component)}, {{}, std::move(action)}}};
  return point;
}

TEST_F(ObjectFilterTest, QuarroHasARuleOnEveryBuild) {
  const struct {
    TestPoint::Text component, action;
    int failingSlot;  // 0 where it passes
  } cases[] = {{"ApplicationWindow", "Open", 0},
               {"Open", "ApplicationWindow", 1},
               {"ApplicationWindow", "Ajar", 2},
               {"ApplicationWindow", {}, 2},
               {{}, "Open", 1}};
  for (const bool internal : {false, true}) {
    variant.internal = internal;
    const auto quarro = makeFilter(Platform::quarro);
    for (const auto& row : cases) {
      const testing::RecordingLog log;
      const auto decision =
          quarro->inspectTesselObject(*makeEvent(perfLoggingPoint(row.component, row.action)));
      const bool passes = row.failingSlot == 0;
      EXPECT_EQ(decision.shouldReport(), passes) << internal << row.failingSlot;
      EXPECT_EQ(decision.stringSlot, row.failingSlot);
      EXPECT_EQ(decision.specialRule, !passes);
      // If the rule fails the object, the whitelist mode is not asked for.
      EXPECT_EQ(log.lines().size(), passes ? 1u : 0u);
    }
  }
}

TEST_F(ObjectFilterTest, TheSpecialRuleExemptsFromTheList) {
  TestPoint point = perfLoggingPoint("ApplicationWindow", "Open");
  point.strings[0].first = "component";
  point.strings[1].first = "action";
  EXPECT_TRUE(makeFilter(Platform::quarro)->shouldReportTesselObject(*makeEvent(point), nullptr));
  // On another platform it is an object like any other, and these are no values of that platform.
  EXPECT_FALSE(filter->shouldReportTesselObject(*makeEvent(point), nullptr));
  // Of another name it is one on Quarro, too, where both values are known.
  point.name = "Other";
  point.strings[0].second = "Open";
  EXPECT_TRUE(makeFilter(Platform::quarro)->shouldReportTesselObject(*makeEvent(point), nullptr));
}

TEST_F(ObjectFilterTest, OnlyALabelledSlotIsTested) {
  const struct {
    TestPoint::Text label1, value1, label2, value2;
    bool passes;
  } cases[] = {{{}, "anything", {}, "anything", true},
               {"label", "week", {}, "anything", true},
               {"label", "Week", {}, {}, false},
               {"label", {}, {}, {}, false},
               {{}, "anything", "label", "small", true},
               {{}, {}, "label", "tiny", false},
               {{}, {}, "label", {}, false},
               {"label", "2,2,1,0", "", "Root", true}};
  for (const auto& row : cases) {
    TestPoint point;
    point.strings = {{{row.label1, row.value1}, {row.label2, row.value2}}};
    const auto object = makeEvent(point);
    variant.internal = false;
    EXPECT_EQ(filter->shouldReportTesselObject(*object, nullptr), row.passes)
        << row.value1.value_or("-") << " " << row.value2.value_or("-");
    variant.internal = true;
    EXPECT_TRUE(filter->shouldReportTesselObject(*object, nullptr));
  }
}

TEST_F(ObjectFilterTest, AnUnknownCodeCountsAsNotReported) {
  filter->incrementTotalForObject(*makeInterval({}), static_cast<TesselReporterClassification>(6));
  EXPECT_EQ(filter->allInspectedTesselObjectsAggregation().totalCount(), 1u);
  EXPECT_EQ(filter->totalUnreportedIntervalCount(), 1u);
  EXPECT_EQ(filter->telemetryReportedAggregation().totalCount(), 0u);
}

// An object of one of the kinds, right or wrong in one way or several.
TestPoint anyPoint(std::mt19937& random) {
  const auto chance = [&random](unsigned in) { return random() % in == 0; };
  TestPoint point;
  point.subsystem = "com.vantor.S" + std::to_string(random() % 5);
  if (chance(7)) point.subsystem = "com.vantor.TextInput";
  point.category = "C" + std::to_string(random() % 3);
  if (chance(20)) point.category = {};
  point.telemetryEnabled = !chance(5);
  point.durationSeconds = chance(5) ? -1.0F : 1.0F;
  if (chance(2)) point.strings[0] = {"period", chance(3) ? "never" : "day"};
  return point;
}

TEST_F(ObjectFilterTest, CountsByReasonAndByKind) {
  const std::function<std::shared_ptr<const TesselObject>(const TestPoint&)> makers[] = {
      makeEvent, makeInterval, makeAnimationInterval, makeObject};
  std::mt19937 random(20261122);
  ClassifiedCounts expected{};
  uint64_t ofKind[4][2] = {};
  constexpr uint64_t kCalls = 5000;
  for (uint64_t i = 0; i < kCalls; ++i) {
    const size_t kind = random() % 4;
    const FilterDecision decision = filter->inspectTesselObject(*makers[kind](anyPoint(random)));
    ++expected[decision.classification];
    ++ofKind[kind][decision.shouldReport()];
  }
  EXPECT_EQ(filter->classifiedCounts(), expected);
  for (const auto& [code, name, title, column] : kClassifications) {
    EXPECT_GT(expected[code], 0u) << name;
    uint64_t sum = 0;
    for (const auto& entry : filter->aggregationFor(code).aggregationDictionary())
      sum += entry.count;
    EXPECT_EQ(sum, expected[code]) << name;
  }
  EXPECT_EQ(filter->allInspectedTesselObjectsAggregation().totalCount(), kCalls);
  EXPECT_EQ(filter->telemetryReportedEventsAggregation().totalCount(), ofKind[0][true]);
  EXPECT_EQ(filter->totalReportedEventCount(), ofKind[0][true]);
  EXPECT_EQ(filter->totalUnreportedEventCount(), ofKind[0][false]);
  EXPECT_EQ(filter->totalReportedIntervalCount(), ofKind[1][true]);
  EXPECT_EQ(filter->totalUnreportedIntervalCount(), ofKind[1][false]);
  EXPECT_EQ(filter->totalReportedAnimationCount(), ofKind[2][true]);
  EXPECT_EQ(filter->totalUnreportedAnimationCount(), ofKind[2][false]);
}

TEST_F(ObjectFilterTest, APlatformMakesTheFilter) {
  EXPECT_EQ(TesselReporterObjectFilter::initWithPlatform(Platform::unknown, variant), nullptr);
  const auto own = TesselReporterObjectFilter::init(variant);
  EXPECT_EQ(own->platform(), Platform::selvin);
  EXPECT_EQ(own->scnFilter(), defaultFilterForPlatform(Platform::selvin));
  EXPECT_NE(own->scnFilter(), nullptr);
  for (const uint64_t code : {3u, 5u, 6u}) {
    const auto other =
        TesselReporterObjectFilter::initWithPlatform(static_cast<Platform>(code), variant);
    EXPECT_EQ(static_cast<uint64_t>(other->platform()), code);
    EXPECT_EQ(other->scnFilter(), nullptr);
  }
}

}  // namespace
}  // namespace tessel
