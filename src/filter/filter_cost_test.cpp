// What deciding costs: no allocation once every (subsystem, category) pair has been seen.

#include <gtest/gtest.h>

#include <vector>

#include "filter/TesselReporterObjectFilter.h"
#include "filter/testing/CountedAllocations.h"
#include "objects/testing/TestObjects.h"

namespace tessel {
namespace {

struct OrdinaryBuild final : BuildVariant {
  bool hasInternalDiagnostics(std::string_view) override { return false; }
};

TEST(FilterCostTest, AKnownPairAllocatesNothing) {
  OrdinaryBuild variant;
  const auto filter = TesselReporterObjectFilter::init(variant);
  filter->setScnFilter(makeDefaultFilterForPlatform(TesselReporterPlatform::selvin));
  std::vector<std::shared_ptr<const TesselObject>> objects;
  for (int i = 0; i < 200; ++i) {
    testing::TestPoint point;
    point.category = "Category" + std::to_string(i % 50);
    if (i % 7 == 0) point.subsystem = "com.vantor.TextInput";
    point.telemetryEnabled = i % 5 != 0;
    point.durationSeconds = i % 11 == 0 ? -1.0F : 1.0F;
    point.strings[0] = {"period", i % 3 == 0 ? "week" : "weekly"};
    objects.push_back(testing::makeEvent(point));
  }
  const auto feed = [&] {
    const size_t before = testing::allocationsSoFar();
    for (const auto& object : objects) filter->shouldReportTesselObject(*object, nullptr);
    return testing::allocationsSoFar() - before;
  };
  EXPECT_GT(feed(), 0u);
  EXPECT_EQ(feed(), 0u);
}

}  // namespace
}  // namespace tessel
