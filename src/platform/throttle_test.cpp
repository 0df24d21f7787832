// Pacing by the fake clock.

#include "platform/Analytics.h"

#include <gtest/gtest.h>

#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using std::chrono::nanoseconds;

class ThrottleTest : public ::testing::Test {
 protected:
  void steps(int count) {
    for (int i = 0; i < count; ++i) throttle.throttleReportedEvent();
  }

  testing::RecordingLog log;
  testing::FakeClock clock;
  Throttle throttle{clock, clock};
};

TEST_F(ThrottleTest, TheTenthStepSleepsToTheQuantumsEnd) {
  steps(9);
  clock.advance(nanoseconds{50'000'100});
  EXPECT_TRUE(clock.sleeps.empty());
  steps(1);
  EXPECT_EQ(clock.sleeps, std::vector<uint32_t>{74'999});
  EXPECT_EQ(throttle.throttledCount(), 1u);
  EXPECT_EQ(throttle.throttledMicroseconds(), 74'999u);
  EXPECT_EQ(
      log.lines(),
      (std::vector<std::string>{
          "125000.000000 us, 125000000.000000 mach time units per quantum of 10 reported events",
          "Sleeping for 74999 us"}));
}

TEST_F(ThrottleTest, ALongQuantumEndsWithoutSleep) {
  steps(9);
  clock.advance(nanoseconds{125'000'000});
  steps(1);
  EXPECT_TRUE(clock.sleeps.empty());
  clock.advance(nanoseconds{100'000'000});
  steps(10);
  EXPECT_EQ(clock.sleeps, std::vector<uint32_t>{25'000});
}

TEST_F(ThrottleTest, TheNewQuantumStartsAfterTheSleep) {
  steps(10);
  steps(11);
  EXPECT_EQ(throttle.stepCount(), 21u);
  EXPECT_EQ(throttle.sleptTicks(), 250'000'000u);
  EXPECT_EQ(clock.sleeps, (std::vector<uint32_t>{125'000, 125'000}));
  EXPECT_EQ(throttle.throttledCount(), 2u);
  EXPECT_EQ(throttle.throttledMicroseconds(), 250'000u);
}

TEST(ThrottleTimebaseTest, TicksCountInTheClocksOwnUnit) {
  testing::RecordingLog log;
  testing::FakeClock clock;
  clock.base = {125, 3};
  Throttle throttle(clock, clock);
  for (int i = 0; i < 9; ++i) throttle.throttleReportedEvent();
  clock.ticks += 1'200'000;  // 50,000 us
  throttle.throttleReportedEvent();
  EXPECT_EQ(clock.sleeps, std::vector<uint32_t>{75'000});
  EXPECT_EQ(
      log.count(
          "125000.000000 us, 3000000.000000 mach time units per quantum of 10 reported events"),
      1u);
}

}  // namespace
}  // namespace tessel
