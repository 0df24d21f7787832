// The datagrams that trace.h sends to the journal, and the points that it refuses.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <clocale>
#include <filesystem>
#include <fstream>
#include <limits>
#include <string>
#include <vector>

#include "TraceTest.h"

namespace {

using ::testing::Pair;
using ::testing::UnorderedElementsAre;

using TraceHeader = TraceTest;

TEST_F(TraceHeader, EventSaysEachThingOnce) {
  const tessel_attribute attributes[] = {{"View", "month"}, {"Empty", ""}};
  tessel_point point = somePoint();
  point.telemetry = true;
  point.string1 = {"period", "week"};
  point.string2 = {"mode", ""};
  point.number1 = tessel_int("count", -7);
  point.number2 = tessel_double("load", 0.5);
  point.attributes = attributes;
  point.attribute_count = 2;
  ASSERT_EQ(tessel_event(&point), 0);
  EXPECT_THAT(only().fields,
              UnorderedElementsAre(
                  Pair("TESSEL_KIND", "event"), Pair("PRIORITY", "7"),
                  Pair("TESSEL_SUBSYSTEM", "com.vantor.Calendar"), Pair("TESSEL_CATEGORY", "View"),
                  Pair("TESSEL_NAME", "Open"), Pair("TESSEL_TELEMETRY", "1"),
                  Pair("TESSEL_STRING1_NAME", "period"), Pair("TESSEL_STRING1_VALUE", "week"),
                  Pair("TESSEL_STRING2_NAME", "mode"), Pair("TESSEL_STRING2_VALUE", ""),
                  Pair("TESSEL_NUMBER1_NAME", "count"), Pair("TESSEL_NUMBER1_VALUE", "-7"),
                  Pair("TESSEL_NUMBER2_NAME", "load"), Pair("TESSEL_NUMBER2_VALUE", "0.5"),
                  Pair("TESSEL_ATTRIBUTE", "View=month"), Pair("TESSEL_ATTRIBUTE", "Empty=")));
}

TEST_F(TraceHeader, AbsentThingsAreLeftOut) {
  tessel_point point{};
  point.subsystem = "com.vantor.Calendar";
  point.category = "View";
  ASSERT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(only().fields.size(), 4u);  // kind, priority, subsystem, category
}

TEST_F(TraceHeader, NumbersKeepTheirKindAndValue) {
  const struct {
    tessel_number number;
    const char* text;
  } cases[] = {
      {tessel_int("n", 0), "0"},
      {tessel_int("n", INT64_MIN), "-9223372036854775808"},
      {tessel_int("n", INT64_MAX), "9223372036854775807"},
      {tessel_uint("n", UINT64_MAX), "18446744073709551615"},
      {tessel_double("n", 3), "3.0"},
      {tessel_double("n", -0.0), "-0.0"},
      {tessel_double("n", 0.1), "0.1"},
      {tessel_double("n", 1.0 / 3), "0.33333333333333331"},
      {tessel_double("n", -1e300), "-1e+300"},
      {tessel_double("n", 5e-324), "4.94065645841247e-324"},
      {tessel_double("n", std::numeric_limits<double>::max()), "1.7976931348623157e+308"},
  };
  for (const auto& each : cases) {
    tessel_point point = somePoint();
    point.number2 = each.number;
    ASSERT_EQ(tessel_event(&point), 0);
    EXPECT_EQ(only()["TESSEL_NUMBER2_VALUE"], each.text);
  }
}

// Compiles a locale whose decimal point is the given character, in a folder of its own, and uses
// it. Answers whether that worked; it needs localedef and the charmaps of the package locales.
bool useDecimalPoint(const std::string& character) {
  const std::string directory = ::testing::TempDir() + "tessel-locale-" + std::to_string(getpid());
  std::filesystem::create_directories(directory);
  std::ofstream(directory + "/source") << "LC_NUMERIC\ndecimal_point \"" << character
                                       << "\"\nthousands_sep \"\"\ngrouping -1\nEND LC_NUMERIC\n";
  const std::string make = "localedef -c -f UTF-8 -i " + directory + "/source " + directory +
                           "/tessel.UTF-8 > /dev/null 2>&1";
  const int ran = std::system(make.c_str());
  setenv("LOCPATH", directory.c_str(), 1);
  const bool used = ran >= 0 && std::setlocale(LC_NUMERIC, "tessel.UTF-8") != nullptr;
  std::filesystem::remove_all(directory);
  return used;
}

class TraceHeaderIn : public TraceHeader, public ::testing::WithParamInterface<const char*> {};

TEST_P(TraceHeaderIn, NumbersDoNotSpeakTheLanguageOfTheUser) {
  ASSERT_TRUE(useDecimalPoint(GetParam())) << "needs the package locales";
  ASSERT_STRNE(std::localeconv()->decimal_point, ".");
  tessel_point point = somePoint();
  point.number1 = tessel_double("n", 1234.5);
  point.number2 = tessel_double("n", 1.5e-20);
  const int error = tessel_event(&point);
  std::setlocale(LC_NUMERIC, "C");
  ASSERT_EQ(error, 0);
  const JournalEntry entry = only();
  EXPECT_EQ(entry["TESSEL_NUMBER1_VALUE"], "1234.5");
  EXPECT_EQ(entry["TESSEL_NUMBER2_VALUE"], "1.5e-20");
}

// A comma, and an Arabic decimal separator, which takes two bytes.
INSTANTIATE_TEST_SUITE_P(DecimalPoints, TraceHeaderIn, ::testing::Values("<U002C>", "<U066B>"));

struct Refusal {
  const char* why;
  int error;
  void (*spoil)(tessel_point&);
};

constexpr double kInfinity = std::numeric_limits<double>::infinity();
constexpr double kNotANumber = std::numeric_limits<double>::quiet_NaN();
constexpr tessel_string kLabelAlone{"label", nullptr};
constexpr tessel_string kValueAlone{nullptr, "value"};
const std::string kLongest(TESSEL_VALUE_MAX, 'x');
const std::string kTooLong(TESSEL_VALUE_MAX + 1, 'x');
const std::string kLongestKey(TESSEL_KEY_MAX, 'k');
const std::string kTooLongKey(TESSEL_KEY_MAX + 1, 'k');

void setAttribute(tessel_point& point, const char* key, const char* value) {
  static tessel_attribute attribute;
  attribute = {key, value};
  point.attributes = &attribute;
  point.attribute_count = 1;
}

TEST_F(TraceHeader, RefusesWhatWouldBeLostLater) {
  const Refusal refusals[] = {
      {"no subsystem", EINVAL, [](tessel_point& p) { p.subsystem = nullptr; }},
      {"empty subsystem", EINVAL, [](tessel_point& p) { p.subsystem = ""; }},
      {"no category", EINVAL, [](tessel_point& p) { p.category = nullptr; }},
      {"empty category", EINVAL, [](tessel_point& p) { p.category = ""; }},
      {"label alone", EBADMSG, [](tessel_point& p) { p.string1 = kLabelAlone; }},
      {"value alone", EBADMSG, [](tessel_point& p) { p.string2 = kValueAlone; }},
      {"not a number", EDOM, [](tessel_point& p) { p.number1 = tessel_double("n", kNotANumber); }},
      {"infinite", EDOM, [](tessel_point& p) { p.number2 = tessel_double("n", -kInfinity); }},
      {"long name", EMSGSIZE, [](tessel_point& p) { p.name = kTooLong.c_str(); }},
      {"long label", EMSGSIZE,
       [](tessel_point& p) { p.number1 = tessel_int(kTooLong.c_str(), 1); }},
      {"no key", ENOKEY, [](tessel_point& p) { setAttribute(p, nullptr, "v"); }},
      {"empty key", ENOKEY, [](tessel_point& p) { setAttribute(p, "", "v"); }},
      {"key with =", ENOKEY, [](tessel_point& p) { setAttribute(p, "a=b", "v"); }},
      {"key with line feed", ENOKEY, [](tessel_point& p) { setAttribute(p, "a\nb", "v"); }},
      {"no attribute value", EBADMSG, [](tessel_point& p) { setAttribute(p, "k", nullptr); }},
      {"long key", ENAMETOOLONG,
       [](tessel_point& p) { setAttribute(p, kTooLongKey.c_str(), "v"); }},
      {"long attribute", EMSGSIZE, [](tessel_point& p) { setAttribute(p, "k", kLongest.c_str()); }},
      {"many attributes", E2BIG,
       [](tessel_point& p) {
         setAttribute(p, "k", "v");
         p.attribute_count = TESSEL_ATTRIBUTES_MAX + 1;
       }},
  };
  for (const Refusal& refusal : refusals) {
    tessel_point point = somePoint();
    refusal.spoil(point);
    EXPECT_EQ(tessel_event(&point), refusal.error) << refusal.why;
    EXPECT_TRUE(journal.take().empty()) << refusal.why;
  }
}

TEST_F(TraceHeader, TakesTheLongest) {
  tessel_point point = somePoint();
  point.name = kLongest.c_str();
  setAttribute(point, kLongestKey.c_str(), kLongest.c_str() + TESSEL_KEY_MAX + 1);
  ASSERT_EQ(tessel_event(&point), 0);
  const JournalEntry entry = only();
  EXPECT_EQ(entry["TESSEL_NAME"], kLongest);
  EXPECT_EQ(entry["TESSEL_ATTRIBUTE"].size(), size_t{TESSEL_VALUE_MAX});
}

TEST_F(TraceHeader, LineFeedsCannotForgeFields) {
  tessel_point point = somePoint();
  const char* forged = "week\nTESSEL_TELEMETRY=1\n";
  point.string1 = {"period", forged};
  setAttribute(point, "Note", forged);
  ASSERT_EQ(tessel_event(&point), 0);
  const JournalEntry entry = only();
  EXPECT_EQ(entry["TESSEL_STRING1_VALUE"], forged);
  EXPECT_EQ(entry["TESSEL_ATTRIBUTE"], std::string("Note=") + forged);
  EXPECT_EQ(entry["TESSEL_TELEMETRY"], JournalEntry::kNone);
}

TEST_F(TraceHeader, WhatTheBufferCannotHoldTravelsAsSealedFile) {
  std::vector<tessel_attribute> attributes(TESSEL_ATTRIBUTES_MAX,
                                           {"Filler", kLongest.c_str() + 100});
  tessel_point point = somePoint();
  point.attributes = attributes.data();
  point.attribute_count = attributes.size();
  ASSERT_EQ(tessel_event(&point), 0);
  const JournalEntry entry = only();
  EXPECT_TRUE(entry.wasFile);
  EXPECT_EQ(entry.seals, F_SEAL_SEAL | F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE);
  EXPECT_EQ(entry.fields.size(), 5u + TESSEL_ATTRIBUTES_MAX);
  EXPECT_EQ(entry.fields.back().second, std::string("Filler=") + (kLongest.c_str() + 100));
}

// trace.h sends small entries from a buffer and large ones through a file. Sizes around the limit
// must arrive whole either way.
TEST_F(TraceHeader, NothingIsLostWhereTheBufferEnds) {
  tessel_point point = somePoint();
  point.string1 = {"label", kLongest.c_str()};
  for (size_t size = 3700; size < 4000; ++size) {
    const std::string value(size, 'v');
    point.string2 = {"label", value.c_str()};
    ASSERT_EQ(tessel_event(&point), 0) << size;
    ASSERT_EQ(only()["TESSEL_STRING2_VALUE"], value) << size;
  }
}

TEST_F(TraceHeader, EndCarriesTheTimeSinceItsBegin) {
  const tessel_point point = somePoint();
  tessel_interval outer;
  tessel_interval inner;
  ASSERT_EQ(tessel_interval_begin(&point, &outer), 0);
  ASSERT_EQ(tessel_interval_begin(&point, &inner), 0);
  ASSERT_EQ(tessel_interval_end(&inner, &point), 0);
  ASSERT_EQ(tessel_interval_end(&outer, &point), 0);
  const std::vector<JournalEntry> entries = journal.take();
  ASSERT_EQ(entries.size(), 4u);
  EXPECT_EQ(entries[0]["TESSEL_KIND"], "begin");
  EXPECT_EQ(entries[0]["TESSEL_DURATION"], JournalEntry::kNone);
  EXPECT_EQ(entries[2]["TESSEL_KIND"], "end");
  EXPECT_EQ(entries[1]["TESSEL_INTERVAL_ID"], entries[2]["TESSEL_INTERVAL_ID"]);
  EXPECT_EQ(entries[0]["TESSEL_INTERVAL_ID"], entries[3]["TESSEL_INTERVAL_ID"]);
  EXPECT_NE(entries[0]["TESSEL_INTERVAL_ID"], entries[1]["TESSEL_INTERVAL_ID"]);
  const double innerSeconds = std::stod(entries[2]["TESSEL_DURATION"]);
  const double outerSeconds = std::stod(entries[3]["TESSEL_DURATION"]);
  EXPECT_GT(innerSeconds, 0);
  EXPECT_GT(outerSeconds, innerSeconds);
  EXPECT_LT(outerSeconds, 60);
}

TEST_F(TraceHeader, DurationIsSecondsWithNineDecimals) {
  const struct {
    uint64_t nanoseconds;
    const char* text;
  } cases[] = {{0, "0.000000000"},
               {1, "0.000000001"},
               {1'500'000'000, "1.500000000"},
               {86'400'000'000'007, "86400.000000007"},
               {UINT64_MAX, "18446744073.709551615"}};
  for (const auto& each : cases) {
    tessel_message_ message;
    tessel_start_(&message);
    tessel_put_duration_(&message, each.nanoseconds);
    EXPECT_EQ(std::string(message.bytes, message.used),
              std::string("TESSEL_DURATION=") + each.text + "\n");
  }
}

TEST_F(TraceHeader, AnIntervalEndsOnceAndOnlyWhereItBegan) {
  const tessel_point point = somePoint();
  tessel_point bad = point;
  bad.category = nullptr;
  tessel_interval token;
  ASSERT_EQ(tessel_interval_begin(&point, &token), 0);
  ASSERT_EQ(tessel_interval_end(&token, &point), 0);
  EXPECT_EQ(tessel_interval_end(&token, &point), ECANCELED);
  EXPECT_EQ(tessel_interval_begin(&bad, &token), EINVAL);
  EXPECT_EQ(tessel_interval_end(&token, &point), EINVAL);
  tessel_enable(false);
  EXPECT_EQ(tessel_interval_begin(&point, &token), 0);
  tessel_enable(true);
  EXPECT_EQ(tessel_interval_end(&token, &point), ECANCELED);
  EXPECT_EQ(journal.take().size(), 2u);
}

TEST_F(TraceHeader, AnIntervalMaySpanProcesses) {
  tessel_point point = somePoint();
  point.interval_id = "boot-42";
  point.system_scope = true;
  tessel_interval token;
  ASSERT_EQ(tessel_interval_begin(&point, &token), 0);
  ASSERT_EQ(tessel_interval_end(nullptr, &point), 0);
  const std::vector<JournalEntry> entries = journal.take();
  ASSERT_EQ(entries.size(), 2u);
  for (const JournalEntry& entry : entries) {
    EXPECT_EQ(entry["TESSEL_INTERVAL_ID"], "boot-42");
    EXPECT_EQ(entry["TESSEL_INTERVAL_SCOPE"], "system");
  }
  EXPECT_EQ(entries[1]["TESSEL_DURATION"], JournalEntry::kNone);
}

TEST_F(TraceHeader, AnimationEndCarriesTheFrameRate) {
  const tessel_point point = somePoint();
  tessel_interval token;
  tessel_interval_begin(&point, &token);
  ASSERT_EQ(tessel_animation_end(&token, &point, 59.94), 0);
  EXPECT_EQ(journal.take().back()["TESSEL_FRAME_RATE"], "59.94");
  tessel_interval_begin(&point, &token);
  EXPECT_EQ(tessel_animation_end(&token, &point, kNotANumber), EDOM);
  tessel_interval_begin(&point, &token);
  EXPECT_EQ(tessel_animation_end(&token, &point, 1e39), EDOM) << "no 32-bit float";
}

}  // namespace
