// The cache never returns the token of one place for another.

#include "journal/TokenCache.h"

#include <gtest/gtest.h>

#include <map>
#include <random>
#include <utility>

namespace tessel {
namespace {

constexpr uint64_t kLastPlace = (uint64_t{1} << 35) - 8;

TEST(TokenCacheTest, ReturnsTheLastStoredOrNothing) {
  TokenCache cache;
  std::mt19937_64 random(1);
  std::map<std::pair<uint32_t, uint64_t>, FieldToken> stored;
  const auto place = [&](uint64_t range) {
    // From the first to the last file, from the beginning to the last offset.
    const auto file = static_cast<uint32_t>(random() % 2 == 0 ? 0 : TokenCache::kMaxFiles - 1);
    const uint64_t offset = random() % range * 8;
    return std::pair(file, random() % 2 == 0 ? offset : kLastPlace - offset);
  };
  for (const uint64_t range : {uint64_t{1000}, uint64_t{10'000'000}}) {
    size_t known = 0;
    for (FieldToken token = 0; token < 200'000; ++token) {
      const auto written = place(range);
      TokenCache::OfFile(cache, written.first).store(written.second, {token, ~token});
      stored[written] = token;
      const auto asked = place(range);
      const auto found = TokenCache::OfFile(cache, asked.first).find(asked.second);
      if (found.token == TokenCache::kUnknown) continue;
      ++known;
      ASSERT_TRUE(stored.contains(asked));
      ASSERT_EQ(found.token, stored[asked]);
      ASSERT_EQ(found.hash, ~found.token);
    }
    EXPECT_GT(known, range == 1000 ? 150'000 : 0);
  }
  EXPECT_TRUE(TokenCache::takes(kLastPlace));
  EXPECT_FALSE(TokenCache::takes(kLastPlace + 8));
  EXPECT_FALSE(TokenCache::takes(7)) << "no object begins there";
  cache.useGeneration(1);
  for (const auto& [known, token] : stored)
    ASSERT_EQ(TokenCache::OfFile(cache, known.first).find(known.second).token,
              TokenCache::kUnknown);
}

}  // namespace
}  // namespace tessel
