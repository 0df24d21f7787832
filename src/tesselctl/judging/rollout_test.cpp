// The draw of a roll-out: near the share, nested and stable.

#include "tesselctl/judging/Rollout.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdio>
#include <set>

#include "os/testing/TemporaryDirectory.h"

namespace tessel::ctl {
namespace {

// Ids as a careless fleet has them: they count up.
std::string idOf(unsigned machine) {
  char text[33];
  std::snprintf(text, sizeof text, "%024x%08x", 0, machine);
  return text;
}

std::set<unsigned> machinesIn(const char* share, const char* cohort) {
  std::set<unsigned> in;
  for (unsigned machine = 0; machine < 10'000; ++machine) {
    if (placeOf(idOf(machine), cohort).value() < shareOf(share).value()) in.insert(machine);
  }
  return in;
}

TEST(RolloutTest, TheShareOfAFleetIsNearAndNested) {
  std::set<unsigned> before;
  for (const auto& [text, share] : {std::pair{"0%", 0.0},
                                    {"0.5%", 0.005},
                                    {"5%", 0.05},
                                    {"20%", 0.2},
                                    {"50%", 0.5},
                                    {"99.5%", 0.995},
                                    {"100%", 1.0}}) {
    const auto in = machinesIn(text, "spring");
    // Four standard deviations of a fair draw. The draw is fixed, so this passes always or never.
    const double deviation = std::sqrt(10'000 * share * (1 - share));
    EXPECT_NEAR(static_cast<double>(in.size()), 10'000 * share, 4 * deviation) << text;
    EXPECT_TRUE(std::includes(in.begin(), in.end(), before.begin(), before.end())) << text;
    before = in;
  }
  // Another cohort draws anew: of its 20 %, a fifth is in the first 20 %, too.
  std::vector<unsigned> both;
  const auto spring = machinesIn("20%", "spring"), autumn = machinesIn("20%", "autumn");
  std::set_intersection(spring.begin(), spring.end(), autumn.begin(), autumn.end(),
                        std::back_inserter(both));
  EXPECT_NEAR(static_cast<double>(both.size()), 400, 4 * std::sqrt(10'000 * 0.04 * 0.96));
}

TEST(RolloutTest, EachTenthOfTheFleetIsATenth) {
  int tenths[10] = {};
  for (unsigned machine = 0; machine < 10'000; ++machine)
    ++tenths[placeOf(idOf(machine), "spring").value() / (kWholeFleet / 10)];
  double squares = 0;
  for (const int count : tenths) squares += (count - 1000.0) * (count - 1000.0) / 1000.0;
  EXPECT_LT(squares, 27.9) << "of 1,000 fair draws one is beyond that";
}

// Other values would take machines out of roll-outs that have begun.
TEST(RolloutTest, APlaceNeverChanges) {
  EXPECT_EQ(placeOf("0123456789abcdef0123456789abcdef", "spring"), 560922u);
  EXPECT_EQ(placeOf("0123456789abcdef0123456789abcdef", "default"), 198361u);
  for (const char* bad : {"", "0123", "uninitialized", "0123456789abcdef0123456789abcdeg"})
    EXPECT_EQ(placeOf(bad, "spring"), std::nullopt) << bad;
}

TEST(RolloutTest, OnlyPercentagesAreShares) {
  EXPECT_EQ(shareOf("5%"), 50'000u);
  EXPECT_EQ(shareOf("0.0001%"), 1u);
  EXPECT_EQ(shareOf("100.0000%"), kWholeFleet);
  for (const char* bad : {"", "5", "%", ".5%", "5.%", "-5%", "+5%", "5 %", "1e1%", "100.0001%",
                          "101%", "9999%", "0.00001%", "5%%", "0x5%", "5.5.5%"})
    EXPECT_EQ(shareOf(bad), std::nullopt) << bad;
}

TEST(RolloutTest, ReadsBackWhatItWrote) {
  const testing::TemporaryDirectory directory;
  LaunchConfiguration launch;
  launch.configurationDirectory = directory.path();
  for (const Rollout& each :
       {Rollout{50'000, "spring"}, {1, "a.b-c_9"}, {kWholeFleet, "x"}, {123'456, "y"}, {0, "z"}}) {
    ASSERT_FALSE(writeRollout(launch, each));
    EXPECT_EQ(readRollout(launch), each) << directory.read("rollout.json");
  }
  for (const char* bad :
       {"", "[]", "{}", R"({"share":5,"cohort":"a"})", R"({"share":"5%","cohort":"a/b"})",
        R"({"share":"5%","cohort":""})", R"({"share":"500%","cohort":"a"})"}) {
    directory.write("rollout.json", bad);
    EXPECT_EQ(readRollout(launch), std::nullopt) << bad;
  }
  ASSERT_FALSE(writeRollout(launch, std::nullopt));
  EXPECT_FALSE(std::filesystem::exists(rolloutFile(launch)));
  EXPECT_FALSE(writeRollout(launch, std::nullopt)) << "it is gone already";
}

}  // namespace
}  // namespace tessel::ctl
