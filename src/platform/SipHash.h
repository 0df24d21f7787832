// SipHash-2-4, a hash with a key: whoever does not know the key can neither foresee a hash nor tell
// which hashes were made with the same key. Written after the public description of the algorithm.
//
// Pure functions.

#pragma once

#include <array>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <string_view>

namespace tessel {

// The state between two words. The journal's reader hashes with it, too.
struct SipState {
  uint64_t v0, v1, v2, v3;

  SipState(uint64_t k0, uint64_t k1)
      : v0(k0 ^ 0x736f6d6570736575),
        v1(k1 ^ 0x646f72616e646f6d),
        v2(k0 ^ 0x6c7967656e657261),
        v3(k1 ^ 0x7465646279746573) {}

  void round() {
    v0 += v1;
    v2 += v3;
    v1 = std::rotl(v1, 13) ^ v0;
    v3 = std::rotl(v3, 16) ^ v2;
    v0 = std::rotl(v0, 32) + v3;
    v2 += v1;
    v3 = std::rotl(v3, 21) ^ v0;
    v1 = std::rotl(v1, 17) ^ v2;
    v2 = std::rotl(v2, 32);
  }
  void take(uint64_t word) {
    v3 ^= word;
    round();
    round();
    v0 ^= word;
  }
  uint64_t finish() {
    for (int i = 0; i < 4; ++i) round();
    return v0 ^ v1 ^ v2 ^ v3;
  }
};

using SipKey = std::array<uint8_t, 16>;
using SipHash128 = std::array<uint8_t, 16>;

SipHash128 sipHash128(std::string_view bytes, const SipKey& key);

}  // namespace tessel
