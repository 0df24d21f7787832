// The index against a map of the standard library.

#include "platform/FlatIndex.h"

#include <gtest/gtest.h>

#include <random>
#include <unordered_map>

namespace tessel {
namespace {

// Keys under few hashes, some of them all under one and at the end of the table, so that searches
// are long, wrap around and pass over holes.
uint32_t hashOf(uint64_t key, uint32_t hashes) {
  return hashes == 1 ? UINT32_MAX : hashWords(key) % hashes;
}

TEST(FlatIndexTest, AnswersAsAMapDoesUnderAnyHashes) {
  std::mt19937 random(1);
  for (const uint32_t hashes : {1u, 3u, 40u, 1u << 31}) {
    std::vector<uint64_t> slab;
    FlatIndex index(0);
    std::unordered_map<uint64_t, uint32_t> expected;
    for (int step = 0; step < 20000; ++step) {
      const uint64_t key = random() % 300;
      const uint32_t hash = hashOf(key, hashes);
      const auto isKey = [&](uint32_t number) { return slab[number] == key; };
      const auto known = expected.find(key);
      ASSERT_EQ(index.find(hash, isKey),
                known == expected.end() ? FlatIndex::kNone : known->second);
      if (random() % 2 == 0) {
        const uint32_t number = index.findOrAdd(hash, isKey, [&] {
          slab.push_back(key);
          return static_cast<uint32_t>(slab.size() - 1);
        });
        ASSERT_EQ(expected.try_emplace(key, number).first->second, number);
      } else if (known != expected.end()) {
        index.erase(hash, known->second);
        expected.erase(known);
      }
      ASSERT_EQ(index.size(), expected.size());
      if (random() % 5000 == 0) {
        index.clear();
        expected.clear();
      }
    }
  }
}

}  // namespace
}  // namespace tessel
