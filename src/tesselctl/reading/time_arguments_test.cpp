// Dates and durations of a command line.

#include "tesselctl/reading/TimeArguments.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>

namespace tessel::ctl {
namespace {

using std::chrono::microseconds;
using std::chrono::seconds;

class TimeArgumentsTest : public ::testing::Test {
 protected:
  void SetUp() override { useZone("CET-1CEST,M3.5.0,M10.5.0/3"); }
  void TearDown() override { useZone("UTC"); }
  static void useZone(const char* zone) {
    ::setenv("TZ", zone, 1);
    ::tzset();
  }

  // 2026-11-22 21:45:30 UTC, 22:45:30 local time.
  const Date now{seconds{1'795'383'930}};
};

TEST_F(TimeArgumentsTest, DatesAreReadInEveryPromisedForm) {
  const struct {
    const char* text;
    int64_t secondsBeforeNow;
  } cases[] = {
      {"now", 0},
      {"today", 22 * 3600 + 45 * 60 + 30},
      {"yesterday", 86'400 + 22 * 3600 + 45 * 60 + 30},
      {"2026-11-22", 22 * 3600 + 45 * 60 + 30},
      {"2026-11-22 22:45", 30},
      {"2026-11-22T22:45:29", 1},
      {"2026-11-22T21:45:30Z", 0},
      {"2026-11-22 22:45:30+01:00", 0},
      {"2026-11-22 14:45:30-0700", 0},
      {"2026-10-25 00:00", 28 * 86'400 + 23 * 3600 + 45 * 60 + 30},  // summer time
      {"22:45", 30},
      {"22:45:30", 0},
      {"@1795383900", 30},
      {"-90s", 90},
      {"-1h30m", 5400},
      {"2 hours ago", 7200},
      {"1 day 2 h ago", 93'600},
      {"1w ago", 604'800},
  };
  for (const auto& [text, before] : cases) {
    EXPECT_EQ(parseDate(text, now), now - seconds{before}) << text;
  }
  EXPECT_EQ(parseDate("@1795383930.000250999", now), now + microseconds{250});
  EXPECT_EQ(parseDate("22:45:30.5", now), now + microseconds{500'000});
}

TEST_F(TimeArgumentsTest, WhatIsNoDateIsNone) {
  const std::vector<const char*> kDates = {"",           "soon",       "2026",
                                           "2026-13-01", "2026-02-29", "2026-1-1"};
  const std::vector<const char*> kTimes = {"2026-11-22T",
                                           "2026-11-22 22",
                                           "2026-11-22 22:60",
                                           "2026-11-22 24:00",
                                           "2026-11-22 22:45:30.",
                                           "22:45:",
                                           "99:00"};
  const std::vector<const char*> kZones = {"2026-11-22 22:45Q", "2026-11-22 22:45+1",
                                           "2026-11-22 22:45Z "};
  const std::vector<const char*> kEpochs = {"@", "@x", "@1.", "@99999999999999999999"};
  const std::vector<const char*> kAgo = {"-",   "-24",  "-h",      "24h",
                                         "ago", " ago", "-1h ago", "-999999999999w"};
  for (const auto& texts : {kDates, kTimes, kZones, kEpochs, kAgo}) {
    for (const char* text : texts) EXPECT_EQ(parseDate(text, now), std::nullopt) << text;
  }
}

TEST_F(TimeArgumentsTest, DurationsNeedAUnit) {
  EXPECT_EQ(parseDuration("1h30m"), std::chrono::minutes{90});
  EXPECT_EQ(parseDuration("2 days 1 second"), std::chrono::hours{48} + seconds{1});
  for (const char* text :
       {"", "0s", "5", "h", "1.5h", "-1h", "1y", "1h x", "365001d", "1 h 999999999999 h"}) {
    EXPECT_EQ(parseDuration(text), std::nullopt) << text;
  }
}

TEST_F(TimeArgumentsTest, APeriodIsADayUnlessToldOtherwise) {
  const auto period = [&](const PeriodArguments& arguments) {
    return periodOf(arguments, now).period;
  };
  ASSERT_TRUE(period({}));
  EXPECT_EQ(period({})->start, now - std::chrono::hours{24});
  EXPECT_EQ(period({})->end, now);
  EXPECT_EQ(period({"", "-1h", ""})->length(), std::chrono::hours{24});
  EXPECT_EQ(period({"", "-1h", "10m"})->start, now - std::chrono::minutes{70});
  EXPECT_EQ(period({"-2h", "-1h", ""})->length(), std::chrono::hours{1});
  EXPECT_FALSE(period({"-1h", "-1h", ""}));
  EXPECT_FALSE(period({"-1h", "", "1h"}));
  EXPECT_NE(periodOf({"so\x1bon", "", ""}, now).error.find("--since: 'so\\x1bon'"),
            std::string::npos);
}

}  // namespace
}  // namespace tessel::ctl
