// One object on its own: what is said, counted and paced where it cannot be sent.

#include "service/ObjectReporter.h"

#include <gtest/gtest.h>

#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

struct WithoutPayload final : TesselObject {
  using TesselObject::TesselObject;
  bool canGenerateStatoraPayload() const override { return true; }
  std::optional<Payload> statoraPayload(ProcessIdentity& /*identity*/) const override { return {}; }
};

TEST(ObjectReporterTest, AnObjectWhosePayloadCannotBeMadeIsSaidCountedAndNeitherPacedNorSent) {
  const testing::RecordingLog log;
  testing::FakeClock clock;
  testing::FakeBuildVariant variant;
  testing::FakeBundles bundles;
  testing::RememberingSender sender;
  testing::ManualQueue reportingQueue{"reporting"};
  Throttle throttle(clock);
  ProcessIdentity identity(bundles);
  const auto filter = TesselReporterObjectFilter::init(variant);
  ObjectReporter reporter({identity, throttle, sender, reportingQueue}, filter, {},
                          SharedString("SSD"));

  const SharedString subsystem("com.vantor.Calendar");
  const SharedString category("View");
  const SharedString name("Open");
  TracePointFields fields;
  fields.subsystem = subsystem;
  fields.category = category;
  fields.name = name;
  fields.telemetryEnabled = true;
  for (int i = 0; i < 10; ++i)
    EXPECT_TRUE(reporter.reportTesselObject(std::make_shared<const WithoutPayload>(fields)));

  EXPECT_EQ(log.count("Failed to create payload for com.vantor.Calendar/ViewOpen"), 10u);
  EXPECT_EQ(filter->telemetryReportedAggregation().totalCount(), 10u);
  EXPECT_EQ(throttle.throttledCount(), 0u);
  EXPECT_EQ(reportingQueue.pending(), 0u);
}

}  // namespace
}  // namespace tessel
