// What counts as a configuration, and what its numbers are.

#include <gtest/gtest.h>

#include "statora/ConfigurationFiles.h"

namespace tessel {
namespace {

TEST(ConfigurationJsonTest, NumbersKeepTheirKind) {
  const struct {
    const char* text;
    Number number;
  } cases[] = {
      {"true", Number{true}},
      {"false", Number{false}},
      {"1", Number{int64_t{1}}},
      {"-9223372036854775808", Number{std::numeric_limits<int64_t>::min()}},
      {"18446744073709551615", Number{uint64_t{18446744073709551615u}}},
      {"0.0", Number{0.0}},
      {"18446744073709551616", Number{18446744073709551616.0}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text);
    const auto configuration = parseConfiguration(std::string("{\"TaskedOn\":") + c.text + "}");
    ASSERT_NE(configuration, nullptr);
    const auto& dictionary = std::get<ConfigurationValue::Dictionary>(configuration->value);
    EXPECT_EQ(std::get<Number>(dictionary.at("TaskedOn").value), c.number);
  }
}

TEST(ConfigurationJsonTest, TheLastOfEqualKeysCounts) {
  const auto configuration =
      parseConfiguration("\n{\"a\":[1,null,\"\\u00fc\"],\"b\":{\"a\":2},\"a\":[[],{}, \"x\"]}\n");
  ASSERT_NE(configuration, nullptr);
  const auto& dictionary = std::get<ConfigurationValue::Dictionary>(configuration->value);
  ASSERT_EQ(dictionary.size(), 2u);
  const auto& list = std::get<ConfigurationValue::List>(dictionary.at("a").value);
  ASSERT_EQ(list.size(), 3u);
  EXPECT_TRUE(std::holds_alternative<ConfigurationValue::List>(list[0].value));
  EXPECT_TRUE(std::holds_alternative<ConfigurationValue::Dictionary>(list[1].value));
  EXPECT_EQ(std::get<std::string>(list[2].value), "x");
  const auto& inner = std::get<ConfigurationValue::Dictionary>(dictionary.at("b").value);
  EXPECT_EQ(std::get<Number>(inner.at("a").value), Number{int64_t{2}});
}

TEST(ConfigurationJsonTest, NonsenseIsNoConfiguration) {
  const std::string deep(kMaxConfigurationDepth + 1, '[');
  const std::string endless(1 << 20, '[');
  for (const std::string& text :
       {std::string(), std::string("{\"TaskedOn\":true"), std::string("{\"TaskedOn\":true}x"),
        std::string("{}{}"), std::string("{'TaskedOn':true}"), std::string("{\"TaskedOn\":TRUE}"),
        std::string("[1e999]"), std::string("[\"\xff\"]"), std::string("[1,]"),
        std::string("{}\0", 3), deep + std::string(deep.size(), ']'), endless}) {
    EXPECT_EQ(parseConfiguration(text), nullptr) << text.substr(0, 60);
  }
  const std::string allowed(kMaxConfigurationDepth, '[');
  EXPECT_NE(parseConfiguration(allowed + std::string(allowed.size(), ']')), nullptr);
}

}  // namespace
}  // namespace tessel
