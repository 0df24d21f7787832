// Verdicts, waits and pace.

#include "forwarder/DeliveryPolicy.h"

#include <gtest/gtest.h>

#include "forwarder/Encoder.h"

#include "forwarder/Otlp.h"

namespace tessel {
namespace {

using std::chrono::milliseconds;
using std::chrono::nanoseconds;
using std::chrono::seconds;

TEST(PolicyTest, EveryStatusHasItsVerdict) {
  const std::pair<Verdict, std::vector<long>> kCases[] = {
      {Verdict::accepted, {200, 201, 204, 299}},
      {Verdict::later, {0, 408, 425, 429, 502, 503, 504, 507, 520, 599}},
      {Verdict::hold, {100, 301, 304, 401, 402, 403, 404, 405, 407, 410, 415, 501, 505, 511}},
      {Verdict::refused, {400, 413, 422, 500}},
  };
  const auto encoder = outputFormats().front()->makeEncoder({});
  CollectorAnswer answer;
  for (const auto& [verdict, statuses] : kCases) {
    for (const long status : statuses) {
      answer.status = status;
      EXPECT_EQ(verdictOn(answer, *encoder), verdict) << status;
    }
  }
}

TEST(OtlpAnswerTest, OnlyAnAnswerOfTheProtocolIsASuccess) {
  using namespace std::string_view_literals;
  const struct {
    std::string_view body;
    std::optional<uint64_t> rejected;
    const char* message;
  } cases[] = {
      {"\x0a\x07\x08\x07\x12\x03why"sv, 7, "why"},
      {"\x0a\x00"sv, 0, ""},
      {"\x12\x01x\x0a\x02\x08\x02"sv, 2, ""},
      {"\x0a\x0b\x08\xff\xff\xff\xff\xff\xff\xff\xff\xff\x01"sv, 0, ""},
      {"\x12\x01x"sv, {}, ""},
      {"\x0a\x05\x08\x07"sv, {}, ""},
      {"\x0a\x02\x08\xff"sv, {}, ""},
      {"OK"sv, {}, ""},
      {R"({"partialSuccess":{"rejectedLogRecords":"7","errorMessage":"why"}})", 7, "why"},
      {R"({"partialSuccess":{"rejectedLogRecords":7},"later":1})", 7, ""},
      {R"({"partialSuccess":{"errorMessage":"a warning"}})", 0, "a warning"},
      {R"({"partialSuccess":{"rejectedLogRecords":-7}})", 0, ""},
      {R"({"partialSuccess":{"rejectedLogRecords":{}}})", 0, ""},
      {"{}\n", 0, ""},
      {"", 0, ""},
      {R"({"partialSuccess":[1]})", {}, ""},
      {R"({"error":"sign in"})", {}, ""},
      {"7", {}, ""},
      {"<html>", {}, ""},
      {R"({"partialSuccess":{"rejectedLogRecords":"7")", {}, ""},
  };
  for (const auto& c : cases) {
    const auto told = readOtlpSuccess("application/json", c.body);
    ASSERT_EQ(told.has_value(), c.rejected.has_value()) << c.body;
    if (!told) continue;
    EXPECT_EQ(told->rejected, *c.rejected) << c.body;
    EXPECT_EQ(told->message, c.message) << c.body;
  }
  EXPECT_FALSE(readOtlpSuccess("text/html", "{}"));
}

TEST(PolicyTest, WordsOfACollectorAreFitForATerminal) {
  CollectorAnswer answer;
  answer.error = "no\x1b[31m route\n";
  EXPECT_EQ(answerWords(answer), "no\\x1b[31m route ");
  answer.status = 400;
  answer.body = std::string(100'000, 'x') + "\x1b";
  EXPECT_EQ(answerWords(answer), "400: " + std::string(300, 'x'));
  answer.body.clear();
  EXPECT_EQ(answerWords(answer), "400");
}

TEST(PolicyTest, WaitsDoubleAndHalfIsChance) {
  const Backoff backoff(seconds{5}, seconds{300});
  const struct {
    uint32_t failures;
    double chance;
    std::optional<seconds> asked;
    milliseconds wait;
  } cases[] = {
      {1, 0.0, {}, milliseconds{2500}},
      {1, 0.5, {}, milliseconds{3750}},
      {2, 0.0, {}, milliseconds{5000}},
      {4, 0.0, {}, milliseconds{20'000}},
      {7, 0.0, {}, milliseconds{150'000}},
      {4'000'000'000, 0.0, {}, milliseconds{150'000}},
      {1, 0.0, seconds{60}, milliseconds{60'000}},
      {9, 0.5, seconds{60}, milliseconds{75'000}},
      {1, 0.5, seconds{1}, milliseconds{3500}},
      {1, 0.0, seconds{1'000'000'000}, milliseconds{3'600'000}},
  };
  for (const auto& c : cases)
    EXPECT_EQ(backoff.wait(c.failures, c.chance, c.asked), c.wait) << c.failures;
}

TEST(PolicyTest, ABatchIsAsLargeAsTheCollectorTakes) {
  BatchSize size(1024);
  size.taken(1024);
  EXPECT_EQ(size.bytes(), 1024u);
  size.tooMuch(1000);
  EXPECT_EQ(size.bytes(), 500u);
  size.tooMuch(1);
  EXPECT_EQ(size.bytes(), 1u);
  // A limit of 300: few requests are too large, and the size is near the limit.
  int refused = 0;
  for (int request = 0; request < 1000; ++request) {
    size.bytes() > 300 ? (++refused, size.tooMuch(size.bytes())) : size.taken(size.bytes());
  }
  EXPECT_LT(refused, 30);
  EXPECT_GE(size.bytes(), 128u);
  // The limit is lifted.
  for (int request = 0; request < 200; ++request) size.taken(size.bytes());
  EXPECT_EQ(size.bytes(), 1024u);
}

TEST(PolicyTest, PaceSpreadsRecordsOverTime) {
  Pace pace(100);
  EXPECT_EQ(pace.waitAt(seconds{1000}), nanoseconds{0});
  pace.sent(512, seconds{1000});
  EXPECT_EQ(pace.waitAt(seconds{1000}), milliseconds{5120});
  EXPECT_EQ(pace.waitAt(seconds{1005}), milliseconds{120});
  EXPECT_EQ(pace.waitAt(seconds{2000}), nanoseconds{0});
  Pace unlimited(0);
  unlimited.sent(512, seconds{1000});
  EXPECT_EQ(unlimited.waitAt(seconds{1000}), nanoseconds{0});
}

}  // namespace
}  // namespace tessel
