// The list of losses: what is told apart, what is summed, and that nothing is left out.

#include "platform/Losses.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace tessel {
namespace {

using ::testing::ElementsAre;

std::vector<std::string> described(const Losses& losses) {
  std::vector<std::string> lines;
  for (const Loss& loss : losses.all())
    lines.push_back(std::to_string(loss.count) + " " + loss.description());
  return lines;
}

TEST(LossesTest, SumsEqualOnesAndDamageOverAllFiles) {
  Losses file;
  file.add(LossCode::fileDamaged, "entry damaged", {{}, 8});
  file.add(LossCode::fileDamaged, "entry damaged", {{}, 64}, 3);
  Losses losses;
  losses.add(LossCode::malformed, "missing TESSEL_KIND", {}, 2);
  for (const char* path : {"/a", "/b", "/c"}) {
    for (Loss loss : file.all()) {
      loss.place.name = path;
      losses.add(loss);
    }
    losses.add(LossCode::fileSkipped, "Permission denied", {path, {}});
  }
  losses.add(LossCode::droppedByDaemon, "over the rate limit", {"x.service", {}}, 0);
  for (const auto& user : {std::optional<uint32_t>(), std::optional<uint32_t>(7)})
    losses.add(LossCode::beyondPairLimit, "too many", {"/opt/a", {}, user}, 2);
  EXPECT_THAT(described(losses),
              ElementsAre("1 file_skipped: Permission denied (/a)",
                          "1 file_skipped: Permission denied (/b)",
                          "1 file_skipped: Permission denied (/c)",
                          "12 file_damaged: entry damaged (/a, byte 8, and 2 more)",
                          "2 malformed: missing TESSEL_KIND",
                          "2 beyond_pair_limit: too many (unknown user, /opt/a)",
                          "2 beyond_pair_limit: too many (user 7, /opt/a)"));
}

TEST(LossesTest, CountsWhatHasNoRoomUnderOther) {
  Losses losses;
  losses.add(LossCode::malformed, "words", {}, 5);
  for (uint64_t i = 0; i < 100; ++i)
    losses.add(LossCode::droppedByDaemon, "words", {"unit " + std::to_string(i), {}}, 100);
  losses.add(LossCode::droppedByDaemon, "words", {"unit 0", {}}, 7);
  for (const uint64_t times : {1u, 2u}) {
    EXPECT_EQ(losses.sum(LossCode::droppedByDaemon), times * 10'007);
    EXPECT_EQ(losses.notListed(LossCode::droppedByDaemon), times * 8'400);
    EXPECT_EQ(losses.sum(LossCode::malformed), times * 5);
    ASSERT_EQ(losses.all().size(), Losses::kMaxOfACode + 2);
    EXPECT_EQ(losses.all().front().count, times * 107);
    EXPECT_TRUE(losses.all()[Losses::kMaxOfACode].isOther());
    losses.add(Losses(losses));
  }
}

}  // namespace
}  // namespace tessel
