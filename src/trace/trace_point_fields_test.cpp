// Which texts are numbers, and of which kind.

#include "trace/TracePointFields.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <string>

namespace tessel {
namespace {

TEST(DecimalNumberTest, keepsIntegersElseDoubles) {
  const struct {
    std::string text;
    std::optional<Number> number;
  } cases[] = {
      {"0", int64_t{0}},
      {"-9223372036854775808", INT64_MIN},
      {"9223372036854775807", INT64_MAX},
      {"9223372036854775808", uint64_t{1} << 63},
      {"18446744073709551615", UINT64_MAX},
      {"18446744073709551616", 18446744073709551616.0},
      {"-9223372036854775809", -9223372036854775808.0},
      {"007", int64_t{7}},
      {"1.0", 1.0},
      {"-2.5e-3", -0.0025},
      {".5", 0.5},
      {"", std::nullopt},
      {"-", std::nullopt},
      {"+1", std::nullopt},
      {" 1", std::nullopt},
      {"1 ", std::nullopt},
      {"1,5", std::nullopt},
      {"0x10", std::nullopt},
      {"inf", std::nullopt},
      {"nan", std::nullopt},
      {"1e400", std::nullopt},
      {"1e-400", 0.0},
      {"-1E-400", -0.0},
      {"1e-99999999999999999999", 0.0},
      {"1e+99999999999999999999", std::nullopt},
      {"0." + std::string(400, '0') + "1", 0.0},
      {"0." + std::string(400, '0') + "1e+20", 0.0},
      {"1" + std::string(400, '0') + "e-20", std::nullopt},
      {"1" + std::string(400, '0') + ".5", std::nullopt},
      {"1e-400 ", std::nullopt},
      {std::string("1\0", 2), std::nullopt},
  };
  for (const auto& c : cases) EXPECT_EQ(parseDecimal(c.text), c.number) << c.text;
}

TEST(DecimalNumberTest, floatsStayWithinTheirRange) {
  EXPECT_EQ(parseFloat("3.4028235e38"), std::numeric_limits<float>::max());
  EXPECT_EQ(parseFloat("3.4028236e38"), std::nullopt);
  EXPECT_EQ(parseFloat("1e-60"), 0.0f);
  EXPECT_EQ(parseFloat("1e-400"), 0.0f);
  // Just above the middle of 1 and the next float. The nearest double is the middle itself, from
  // which a second rounding would go down to 1.
  EXPECT_EQ(parseFloat("1.00000005960464477540"), std::nextafter(1.0f, 2.0f));
  EXPECT_EQ(parseFloat("1e39"), std::nullopt);
  EXPECT_EQ(parseFloat("-1e39"), std::nullopt);
  EXPECT_EQ(parseFloat("7"), 7.0f);
}

}  // namespace
}  // namespace tessel
