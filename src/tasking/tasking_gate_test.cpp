// The gate's outcomes, each with its line in the log.

#include <gtest/gtest.h>

#include "platform/testing/Fakes.h"
#include "tasking/TaskingGate.h"

namespace tessel {
namespace {

using Dictionary = ConfigurationValue::Dictionary;
constexpr char kType[] = "com.vantor.performance.tessel_reporter_tasking";

std::shared_ptr<const ConfigurationValue> configuration(ConfigurationValue value) {
  return std::make_shared<const ConfigurationValue>(std::move(value));
}
std::shared_ptr<const ConfigurationValue> taskedOn(ConfigurationValue value) {
  return configuration({Dictionary{{"Other", {Number{false}}}, {"TaskedOn", std::move(value)}}});
}

std::string notReporting(const std::string& reason) {
  return "Not reporting based on not being tasked-on by Statora (" + reason + ")";
}

class TaskingGateTest : public ::testing::Test {
 protected:
  // Delivers the configurations while the gate waits.
  TaskingDecision ask(
      std::vector<std::pair<std::shared_ptr<const ConfigurationValue>, std::string>> deliveries) {
    clock.whileWaiting = [this, deliveries = std::move(deliveries)] {
      for (const auto& [value, type] : deliveries)
        configurations.observers.back()->deliver(value, type);
      queues.runAll();
    };
    return gate.decide();
  }

  testing::RecordingLog log;
  testing::FakeBuildVariant variant;
  testing::FakeConfigurationService configurations;
  testing::ManualQueueFactory queues;
  testing::FakeClock clock;
  TaskingGate gate{variant, configurations, queues, clock};
};

TEST_F(TaskingGateTest, AnInternalBuildDoesNotAsk) {
  variant.internal = true;
  const TaskingDecision decision = gate.decide();
  EXPECT_TRUE(decision.on());
  EXPECT_EQ(decision.source(), TaskingSource::internalBuild);
  EXPECT_EQ(log.lines(), std::vector<std::string>{"Reporting based on os_flavor result"});
  EXPECT_EQ(variant.lastSubsystem, "com.vantor.tessel");
  EXPECT_TRUE(configurations.observers.empty());
  EXPECT_TRUE(queues.queues.empty());
}

TEST_F(TaskingGateTest, TimesOutAfterFiveSeconds) {
  EXPECT_EQ(gate.decide().source(), TaskingSource::absent);
  EXPECT_EQ(log.lines(), std::vector{notReporting("Timeout waiting for config")});
  EXPECT_EQ(clock.waits, std::vector<std::chrono::nanoseconds>{std::chrono::seconds{5}});
  EXPECT_EQ(configurations.observers.at(0)->observed, std::vector<std::string>{kType});
  EXPECT_EQ(configurations.observers.at(0)->queue->label(),
            "tessel_reporter configuration observing queue");
}

TEST_F(TaskingGateTest, EachDecisionHasItsLine) {
  const char* kOn = "Reporting based on being tasked-on by Statora";
  const std::string kOff = notReporting("'TaskedOn' is false");
  const std::string kNoDictionary = notReporting("Non-KVDictionary configuration object");
  const struct {
    std::shared_ptr<const ConfigurationValue> value;
    std::string type;
    std::string line;
  } cases[] = {
      {taskedOn({Number{true}}), "com.vantor.other",
       notReporting("unexpected type string: 'com.vantor.other'")},
      {nullptr, kType, notReporting("nil configuration object")},
      {configuration({ConfigurationValue::List{}}), kType, kNoDictionary},
      {configuration({std::string("TaskedOn")}), kType, kNoDictionary},
      {configuration({Dictionary{{"taskedOn", {Number{true}}}}}), kType,
       "Not reporting since is not tasked-on by Statora (nil value for TaskedOn key)"},
      {taskedOn({std::string("true")}), kType,
       "Not reporting since not tasked-on by Statora (Wrong value class for class for TaskedOn)"},
      {taskedOn({Number{false}}), kType, kOff},
      {taskedOn({Number{int64_t{0}}}), kType, kOff},
      {taskedOn({Number{true}}), kType, kOn},
      {taskedOn({Number{int64_t{1}}}), kType, kOn},
  };
  for (const auto& c : cases) {
    log.clear();
    const TaskingDecision decision = ask({{c.value, c.type}});
    EXPECT_EQ(decision.on(), c.line == kOn) << c.line;
    EXPECT_EQ(log.lines(), std::vector{c.line});
    const bool answered = c.line == kOn || c.line == kOff;
    EXPECT_EQ(decision.source(), answered ? TaskingSource::configuration : TaskingSource::unusable);
  }
}

TEST_F(TaskingGateTest, TheLastConfigurationDecides) {
  EXPECT_TRUE(ask({{nullptr, kType}, {taskedOn({Number{true}}), kType}}).on());
  EXPECT_FALSE(ask({{taskedOn({Number{true}}), kType}, {taskedOn({Number{false}}), kType}}).on());
}

TEST_F(TaskingGateTest, ALateConfigurationIsOnlyLogged) {
  EXPECT_FALSE(gate.shouldReport());
  log.clear();
  configurations.observers.at(0)->deliver(taskedOn({Number{true}}), kType);
  queues.runAll();
  EXPECT_EQ(log.lines(), std::vector<std::string>{"Reporting based on being tasked-on by Statora"});
  EXPECT_FALSE(gate.shouldReport());
  EXPECT_EQ(configurations.observers.size(), 2u);
}

}  // namespace
}  // namespace tessel
