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
      // A day begins at midnight; a weekday is the latest one. Now is a Sunday.
      {"tomorrow", -(3600 + 14 * 60 + 30)},
      {"Tomorrow 08:00", -(9 * 3600 + 14 * 60 + 30)},
      {"yesterday 22:45", 86'430},
      {"sunday", 22 * 3600 + 45 * 60 + 30},
      {"mon", 6 * 86'400 + 22 * 3600 + 45 * 60 + 30},
      {"Saturday 22:45:30", 86'400},
      // Zones, of the database and of the local clocks.
      {"2026-11-22 21:45:30 UTC", 0},
      {"21:45:30Z", 0},
      {"22:45:30 CET", 0},
      {"2026-11-22 16:45:30 America/New_York", 0},
      {"2026-11-23 06:45:30 Asia/Tokyo", 0},
      {"2026-11-22 America/New_York", 16 * 3600 + 45 * 60 + 30},
      {"2026-11-22 18:45:30 -03", 0},
      {"2026-07-01 12:00 CEST", 144 * 86'400 + 11 * 3600 + 45 * 60 + 30},
      // As journalctl prints them: short, short-full, short-precise, short-iso, short-unix.
      {"Nov 22 22:45:30", 0},
      {"Nov  2 22:45:30", 20 * 86'400},
      {"Dec 22 22:45:30", 335 * 86'400},
      {"Sun 2026-11-22 22:45:30 CET", 0},
      {"Sun 2026-11-22 21:45:30 UTC", 0},
      {"2026-11-22T22:45:30+0100", 0},
      {"1795383930", 0},
      {"1795383930.000000", 0},
  };
  for (const auto& [text, before] : cases) {
    EXPECT_EQ(parseDate(text, now).date, now - seconds{before}) << text;
  }
  for (const char* text : {"@1795383930.000250999", "1795383930.000250", "Nov 22 22:45:30.000250",
                           "2026-11-22T22:45:30.000250+0100"}) {
    EXPECT_EQ(parseDate(text, now).date, now + microseconds{250}) << text;
  }
}

// Clocks went back at 3:00 on October 25 and will go forward at 2:00 on March 28.
TEST_F(TimeArgumentsTest, AnHourThatClocksRepeatOrSkipIsNamed) {
  const struct {
    const char* text;
    const char* error;
  } cases[] = {
      {"2026-10-25 02:30",
       "comes twice, because clocks go back: write '2026-10-25 02:30:00+02:00' (CEST) or "
       "'2026-10-25 02:30:00+01:00' (CET)"},
      {"2027-03-28 02:30",
       "is skipped, because clocks go forward from 02:00:00 CET to 03:00:00 CEST: write "
       "'2027-03-28 02:30:00+01:00' (03:30:00 CEST) or '2027-03-28 02:30:00+02:00' (01:30:00 CET)"},
      {"2026-11-01 01:30 America/New_York",
       "comes twice, because clocks go back: write '2026-11-01 01:30:00-04:00' (EDT) or "
       "'2026-11-01 01:30:00-05:00' (EST)"},
      {"2026-07-01 12:00 CET",
       "is not in CET: clocks show CEST then; write '2026-07-01 12:00:00+02:00'"},
      {"Mon 2026-11-22 22:45:30 CET", "is no such day: 2026-11-22 is a Sunday"},
      {"2026-11-22 22:45 Nowhere/Land",
       "names no time zone that is known here: 'Nowhere/Land'; zones look like Z, +01:00, CET or "
       "Europe/Berlin"},
  };
  for (const auto& [text, error] : cases) {
    const DateResult result = parseDate(text, now);
    EXPECT_EQ(result.date, std::nullopt) << text;
    EXPECT_EQ(result.error, error) << text;
  }
  for (const char* text : {"2026-10-25 01:59:59", "2026-10-25 02:30 CEST", "2026-10-25 02:30+02:00",
                           "2026-10-25 02:30 CET", "2026-10-25 03:00"}) {
    EXPECT_TRUE(parseDate(text, now).date) << text;
  }
  EXPECT_EQ(
      *parseDate("2026-10-25 02:30 CET", now).date - *parseDate("2026-10-25 02:30 CEST", now).date,
      std::chrono::hours{1});
  // Where clocks change at midnight, the day begins with its first instant: Cairo skips its first
  // hour, and Havana has it twice.
  EXPECT_EQ(parseDate("2026-04-24 Africa/Cairo", now).date,
            parseDate("2026-04-23T22:00:00Z", now).date);
  EXPECT_EQ(parseDate("2026-11-01 America/Havana", now).date,
            parseDate("2026-11-01T04:00:00Z", now).date);
  // Another zone was looked at; the local one is in force again.
  EXPECT_EQ(dateText(now), "2026-11-22 22:45:30");
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
  const std::vector<const char*> kZones = {
      "2026-11-22 22:45Q",    "2026-11-22 22:45+1", "2026-11-22 22:45Z ", "22:45 ../etc/passwd",
      "22:45 /etc/localtime", "22:45 +15:00",       "22:45 Cet"};
  const std::vector<const char*> kWords = {"monda",      "Nov",         "Nov 32",  "Feb 30 10:00",
                                           "Mon Nov 22", "today 25:00", "now UTC", "tomorrowx"};
  const std::vector<const char*> kEpochs = {"@", "@x", "@1.", "@99999999999999999999"};
  const std::vector<const char*> kAgo = {"-",   "-24",  "-h",      "24h",
                                         "ago", " ago", "-1h ago", "-999999999999w"};
  for (const auto& texts : {kDates, kTimes, kZones, kWords, kEpochs, kAgo}) {
    for (const char* text : texts) EXPECT_EQ(parseDate(text, now).date, std::nullopt) << text;
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
  EXPECT_EQ(period({{}, "-1h", {}})->length(), std::chrono::hours{24});
  EXPECT_EQ(period({{}, "-1h", "10m"})->start, now - std::chrono::minutes{70});
  EXPECT_EQ(period({"-2h", "-1h", {}})->length(), std::chrono::hours{1});
  EXPECT_FALSE(period({"-1h", "-1h", {}}));
  EXPECT_FALSE(period({"-1h", {}, "1h"}));
  EXPECT_FALSE(period({"", {}, {}}));
  EXPECT_NE(periodOf({"so\x1bon", {}, {}}, now).error.find("--since: 'so\\x1bon'"),
            std::string::npos);
}

}  // namespace
}  // namespace tessel::ctl
