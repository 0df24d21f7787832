// The cache never returns the token of one place for another.

#include "journal/TokenCache.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <map>
#include <random>
#include <utility>

namespace tessel {
namespace {

constexpr uint64_t kLastPlace = (uint64_t{1} << 33) - 8;
constexpr uint64_t kObject = 72;  // bytes; no data object is shorter

FieldToken tokenAt(const TokenCache& cache, uint32_t file, uint64_t offset) {
  const TokenCache::Value* found = TokenCache::OfFile(cache, file).find(offset);
  if (found == nullptr) return kNoToken;
  EXPECT_EQ(found->hash, ~found->token);
  return found->token;
}

TEST(TokenCacheTest, ReturnsTheLastStoredOrNothing) {
  TokenCache cache;
  std::mt19937_64 random(1);
  std::map<std::pair<uint32_t, uint64_t>, FieldToken> stored;
  const auto place = [&](uint64_t range) {
    // From the first to the last file, from the beginning to the last offset.
    const auto file = static_cast<uint32_t>(random() % 2 == 0 ? 0 : TokenCache::kMaxFiles - 1);
    const uint64_t offset = random() % range * kObject;
    return std::pair(file, random() % 2 == 0 ? offset : kLastPlace - offset);
  };
  for (const uint64_t range : {uint64_t{1000}, uint64_t{10'000'000}}) {
    size_t known = 0;
    for (FieldToken token = 1; token < 200'000; ++token) {
      const auto written = place(range);
      const TokenCache::OfFile view(cache, written.first);
      if (view.find(written.second) == nullptr) {
        if (token % 2 == 0) view.storeRecurring(written.second, {token, ~token});
        if (token % 2 == 1) view.storeAwaited(written.second, {token, ~token});
        stored[written] = token;
      }
      const auto asked = place(range);
      const FieldToken found = tokenAt(cache, asked.first, asked.second);
      if (found == kNoToken) continue;
      ++known;
      ASSERT_TRUE(stored.contains(asked));
      ASSERT_EQ(found, stored[asked]);
    }
    EXPECT_GT(known, range == 1000 ? 150'000 : 0);
  }
  EXPECT_TRUE(TokenCache::takes(kLastPlace));
  EXPECT_FALSE(TokenCache::takes(kLastPlace + 8));
  EXPECT_FALSE(TokenCache::takes(7)) << "no object begins there";
  cache.useGeneration(1);
  for (const auto& [known, token] : stored)
    ASSERT_EQ(tokenAt(cache, known.first, known.second), kNoToken);
}

// What the reader would have to read again, with a system call each.
TEST(TokenCacheTest, KeepsTheIdsOfOpenIntervalsAndWhatRecursBesideThem) {
  constexpr uint32_t kOpen = 25'000;
  constexpr uint64_t kBegin = 400;  // bytes from one begin to the next
  TokenCache cache;
  const TokenCache::OfFile file(cache, 3);
  for (uint32_t value = 1; value <= 1000; ++value)
    file.storeRecurring(value * kObject, {value, ~value});
  // At first there are only begins, and later an end before each of them.
  const auto id = [&](uint32_t number) {
    return 1'000'000 + (uint64_t{number} + std::max(number, kOpen) - kOpen) * kBegin;
  };
  size_t forgotten = 0;
  for (uint32_t number = 1; number < 100'000; ++number) {
    if (number > kOpen) forgotten += tokenAt(cache, 3, id(number - kOpen)) != number - kOpen;
    file.storeAwaited(id(number), {number, ~number});
    if (number % 100 == 0) forgotten += tokenAt(cache, 3, number / 100 * kObject) != number / 100;
  }
  EXPECT_EQ(forgotten, 0u);
}

}  // namespace
}  // namespace tessel
