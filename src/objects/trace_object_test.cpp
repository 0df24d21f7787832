// The payload of each kind of trace object, key by key.

#include <gtest/gtest.h>

#include "objects/ProcessIdentity.h"
#include "objects/testing/TestObjects.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using testing::makeAnimationInterval;
using testing::makeEvent;
using testing::makeInterval;
using testing::makeObject;
using testing::TestPoint;

class PayloadTest : public ::testing::Test {
 protected:
  std::string json(const TesselSupportObject& object) {
    const auto payload = object.statoraPayload(identity);
    return payload ? payloadJson(*payload) : "none";
  }

  testing::FakeBundles bundles;
  ProcessIdentity identity{bundles};
};

TEST_F(PayloadTest, EachValueStandsUnderItsKeyInOrder) {
  TestPoint point;
  point.strings = {{{"period", "week"}, {"size", "small"}}};
  point.numbers = {{{"count", uint64_t{18446744073709551615u}}, {"share", 0.1}}};
  point.durationSeconds = 0.1F;
  point.beginProcessName = "Calendar";
  EXPECT_EQ(
      json(*makeEvent(point)),
      R"({"Subsystem":"com.vantor.Calendar","Category":"View","Name":"Open",)"
      R"("String1Name":"period","String1Value":"week","String2Name":"size","String2Value":"small",)"
      R"("Number1Name":"count","Number1Value":18446744073709551615,)"
      R"("Number2Name":"share","Number2Value":0.1,)"
      R"("IntervalType":"Event","DurationInSeconds":0.1,"StartProcessName":"Calendar"})");
}

TEST_F(PayloadTest, AbsentValuesAreLeftOutOrUnknown) {
  TestPoint point;
  point.subsystem = point.category = point.name = {};
  // A value without its label, and a label without its value.
  point.strings = {{{{}, "week"}, {"size", {}}}};
  point.numbers = {{{{}, int64_t{1}}, {"share", {}}}};
  EXPECT_EQ(json(*makeEvent(point)),
            R"({"Name":"Unknown","String2Name":"size","Number2Name":"share",)"
            R"("IntervalType":"Event","DurationInSeconds":0.0,"StartProcessName":"Unknown"})");
  // And the other way round.
  point = {};
  point.strings = {{{"period", {}}, {{}, "small"}}};
  point.numbers = {{{"count", {}}, {{}, int64_t{1}}}};
  EXPECT_EQ(json(*makeObject(point)),
            R"({"Subsystem":"com.vantor.Calendar","Category":"View","Name":"Open",)"
            R"("String1Name":"period","Number1Name":"count",)"
            R"("IntervalType":"TesselObject","DurationInSeconds":0.0})");
  EXPECT_EQ(json(TesselSupportObject()), "none");
}

TEST_F(PayloadTest, BeginAndEndHaveNamesOfTheirOwn) {
  bundles.identifiers["/apps/Clock.app"] = "com.vantor.Clock";
  TestPoint point;
  point.beginImagePath = "/apps/Clock.app/Clock";
  point.beginProcessName = "Clock";
  point.endImagePath = "/usr/bin/clockd";
  point.endProcessName = "clockd";
  EXPECT_EQ(json(*makeInterval(point)),
            R"({"Subsystem":"com.vantor.Calendar","Category":"View","Name":"Open",)"
            R"("IntervalType":"Interval","DurationInSeconds":0.0,)"
            R"("StartProcessName":"com.vantor.Clock","EndProcessName":"clockd"})");
  point.subsystem = "com.vantor.morvald";  // which may be overridden, and is not
  point.endProcessName = {};
  point.frameRate = 59.94F;
  EXPECT_EQ(
      json(*makeAnimationInterval(point)),
      R"({"Subsystem":"com.vantor.morvald","Category":"View","Name":"Open",)"
      R"("IntervalType":"AnimationInterval","DurationInSeconds":0.0,)"
      R"("StartProcessName":"com.vantor.Clock","EndProcessName":"Unknown","FrameRate":59.94})");
}

TEST_F(PayloadTest, TheOverrideIsTakenWhereItIsMeant) {
  const struct {
    TestPoint::Text subsystem, category;
    bool taken;
  } cases[] = {{"com.vantor.morvald", "Any", true},
               {"com.vantor.morvald", {}, true},
               {"com.vantor.Harrowmere", "Snapshot", true},
               {"com.vantor.Harrowmere", "snapshot", false},
               {"com.vantor.Harrowmere", {}, false},
               {"com.vantor.Morvald", "Snapshot", false},
               {{}, "Snapshot", false}};
  for (const auto& row : cases) {
    const testing::RecordingLog log;
    TestPoint point;
    point.subsystem = row.subsystem;
    point.category = row.category;
    point.name = "Snapshot";
    point.attributes = {{"Other", "com.vantor.Other"}, {"BundleIdOverride", "com.vantor.Guest"}};
    point.beginImagePath = "/apps/Host.app/Host";
    point.beginProcessName = point.endProcessName = "host";
    bundles.asked.clear();
    ProcessIdentity fresh(bundles);
    const auto payload = makeAnimationInterval(point)->statoraPayload(fresh);
    for (const auto* key : {"StartProcessName", "EndProcessName"}) {
      EXPECT_EQ(std::get<SharedString>(*payload->find(key)).textOr(""),
                row.taken ? "com.vantor.Guest" : "host");
    }
    const std::string path =
        row.subsystem.value_or("(null)") + "/" + row.category.value_or("(null)") + "/Snapshot";
    EXPECT_EQ(log.count(path + ": Overriding bundle ID to com.vantor.Guest"), row.taken);
    EXPECT_EQ(bundles.asked.empty(), row.taken);
  }
}

TEST(TesselClassTest, AnObjectIsOfItsBaseClassesToo) {
  using Answers = std::vector<bool>;  // support object, object, event, interval, animation interval
  const auto answersOf = [](const TesselSupportObject& object) {
    Answers answers;
    for (int kind = 0; kind < 5; ++kind)
      answers.push_back(object.isKindOf(static_cast<TesselClass>(kind)));
    return answers;
  };
  EXPECT_EQ(answersOf(TesselSupportObject()), (Answers{true, false, false, false, false}));
  EXPECT_EQ(answersOf(*makeObject({})), (Answers{true, true, false, false, false}));
  EXPECT_EQ(answersOf(*makeEvent({})), (Answers{true, true, true, false, false}));
  EXPECT_EQ(answersOf(*makeInterval({})), (Answers{true, true, false, true, false}));
  EXPECT_EQ(answersOf(*makeAnimationInterval({})), (Answers{true, true, false, true, true}));
}

}  // namespace
}  // namespace tessel
