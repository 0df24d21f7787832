// Payloads, numbers, shared strings.

#include <gtest/gtest.h>

#include <limits>

#include "platform/Values.h"

namespace tessel {
namespace {

TEST(PayloadTest, KeysKeepTheirOrderWithoutAbsentOnes) {
  Payload payload;
  payload.set("B", SharedString("two"));
  payload.set("A", Number{true});
  payload.set("C", SharedString());
  payload.set("B", SharedString("three"));
  EXPECT_EQ(payloadJson(payload), R"({"B":"three","A":true})");
  EXPECT_EQ(payload.find("C"), nullptr);
}

TEST(PayloadTest, NumbersKeepTheirKind) {
  const struct {
    Number number;
    const char* text;
  } cases[] = {
      {Number{uint64_t{18446744073709551615u}}, "18446744073709551615"},
      {Number{std::numeric_limits<int64_t>::min()}, "-9223372036854775808"},
      {Number{0.1f}, "0.1"},
      {Number{0.1}, "0.1"},
      {Number{16777217.0}, "16777217.0"},
      {Number{5.0f}, "5.0"},
      {Number{-0.0}, "-0.0"},
      {Number{1e300}, "1e+300"},
      {Number{int64_t{5}}, "5"},
      {Number{1.5f}, "1.5"},
      {Number{false}, "false"},
      {Number{std::numeric_limits<float>::quiet_NaN()}, "null"},
  };
  for (const auto& c : cases) EXPECT_EQ(numberText(c.number), c.text);
}

TEST(SharedStringTest, AbsentEqualsNothing) {
  const SharedString absent;
  const SharedString one("one");
  const SharedString other("one");
  EXPECT_FALSE(sameString(absent, absent));
  EXPECT_FALSE(sameString(absent, one));
  EXPECT_FALSE(sameString(absent, std::string_view()));
  EXPECT_TRUE(sameString(one, other));
  EXPECT_EQ(one.hash(), other.hash());
  EXPECT_EQ(absent.hash(), 0u);
  EXPECT_FALSE(sameString(one, SharedString("One")));
}

// Words that the hash multiplies by, and others that a product may not survive.
TEST(SharedStringTest, NoWordMakesTheHashForgetAnother) {
  const auto bytes = [](uint64_t word) {
    return std::string(reinterpret_cast<const char*>(&word), sizeof word);
  };
  const uint64_t words[] = {0, ~uint64_t{0}, 0x9e3779b97f4a7c15u, 0xd1b54a32d192ed03u};
  for (const uint64_t word : words) {
    for (const std::string& end : {std::string(), std::string("end")}) {
      const std::string chosen = bytes(word) + end;
      EXPECT_NE(hashText("Flood--1" + chosen), hashText("Flood--2" + chosen)) << word;
      EXPECT_NE(hashText(bytes(1) + bytes(2) + end),
                hashText(bytes(2 ^ word) + bytes(1 ^ word) + end))
          << word;
    }
  }
}

TEST(SharedStringTest, PoolKeepsOneRecordPerText) {
  StringPool pool;
  std::vector<StringRef> refs;
  refs.reserve(1000);
  for (int i = 0; i < 1000; ++i) refs.push_back(pool.intern("text" + std::to_string(i % 300)));
  EXPECT_EQ(pool.size(), 300u);
  for (size_t i = 0; i < refs.size(); ++i) {
    EXPECT_EQ(refs[i].record(), refs[i % 300].record());
    EXPECT_EQ(refs[i].text(), "text" + std::to_string(i % 300));
  }
}

}  // namespace
}  // namespace tessel
