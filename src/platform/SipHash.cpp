// The hash of 128 bits. The words of both key and text are little-endian on every machine.

#include "platform/SipHash.h"

namespace tessel {

namespace {

// The word of up to eight bytes at `at`; absent bytes are zero.
uint64_t wordAt(const char* at, size_t size) {
  uint64_t word = 0;
  for (size_t i = 0; i < size; ++i) word |= uint64_t{static_cast<uint8_t>(at[i])} << (8 * i);
  return word;
}

void store(uint64_t word, uint8_t* to) {
  for (size_t i = 0; i < sizeof word; ++i) to[i] = static_cast<uint8_t>(word >> (8 * i));
}

}  // namespace

SipHash128 sipHash128(std::string_view bytes, const SipKey& key) {
  const char* const keyBytes = reinterpret_cast<const char*>(key.data());
  SipState state(wordAt(keyBytes, 8), wordAt(keyBytes + 8, 8));
  // These constants separate the long hash from the short one with the same key.
  state.v1 ^= 0xee;
  const char* at = bytes.data();
  size_t left = bytes.size();
  for (; left >= 8; left -= 8, at += 8) state.take(wordAt(at, 8));
  state.take(wordAt(at, left) | uint64_t{bytes.size()} << 56);
  SipHash128 hash;
  state.v2 ^= 0xee;
  store(state.finish(), hash.data());
  state.v1 ^= 0xdd;
  store(state.finish(), hash.data() + 8);
  return hash;
}

}  // namespace tessel
