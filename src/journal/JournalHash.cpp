// Both hashes, written after the public descriptions of the algorithms.

#include "journal/JournalHash.h"

#include <bit>

#include "journal/JournalFormat.h"
#include "platform/SipHash.h"

namespace tessel {

using journal_format::load;

namespace {

struct Lookup3State {
  uint32_t a, b, c;

  void mix() {
    turn(a, c, b, 4);
    turn(b, a, c, 6);
    turn(c, b, a, 8);
    turn(a, c, b, 16);
    turn(b, a, c, 19);
    turn(c, b, a, 4);
  }
  void finish() {
    fold(c, b, 14);
    fold(a, c, 11);
    fold(b, a, 25);
    fold(c, b, 16);
    fold(a, c, 4);
    fold(b, a, 14);
    fold(c, b, 24);
  }

 private:
  static void turn(uint32_t& x, uint32_t& y, uint32_t z, int bits) {
    x -= y;
    x ^= std::rotl(y, bits);
    y += z;
  }
  static void fold(uint32_t& x, uint32_t y, int bits) {
    x ^= y;
    x -= std::rotl(y, bits);
  }
};

// The word of the first four of `size` bytes at `at`; absent bytes are zero. The texts are short,
// so a loop over their last bytes would take as long as the rest of the hash.
uint32_t partOfWord(const uint8_t* at, size_t size) {
  if (size >= sizeof(uint32_t)) return load<uint32_t>(at);
  if (size == 0) return 0;
  // The first, the middle and the last byte: of one or two bytes, some are the same.
  return at[0] | uint32_t{at[size / 2]} << 8 * (size / 2) |
         uint32_t{at[size - 1]} << 8 * (size - 1);
}

}  // namespace

uint64_t lookup3(std::span<const uint8_t> bytes) {
  const uint8_t* at = bytes.data();
  size_t left = bytes.size();
  const uint32_t start = 0xdeadbeef + static_cast<uint32_t>(left);
  Lookup3State state{start, start, start};
  for (; left > 12; left -= 12, at += 12) {
    state.a += load<uint32_t>(at);
    state.b += load<uint32_t>(at + 4);
    state.c += load<uint32_t>(at + 8);
    state.mix();
  }
  if (left > 0) {
    state.a += partOfWord(at, left);
    if (left > 4) state.b += partOfWord(at + 4, left - 4);
    if (left > 8) state.c += partOfWord(at + 8, left - 8);
    state.finish();
  }
  return uint64_t{state.c} << 32 | state.b;
}

uint64_t sipHash24(std::span<const uint8_t> bytes, const Id128& key) {
  SipState state(load<uint64_t>(key.data()), load<uint64_t>(key.data() + 8));
  const uint8_t* at = bytes.data();
  size_t left = bytes.size();
  for (; left >= 8; left -= 8, at += 8) state.take(load<uint64_t>(at));
  const uint64_t upper = left > 4 ? partOfWord(at + 4, left - 4) : 0;
  state.take(partOfWord(at, left) | upper << 32 | uint64_t{bytes.size()} << 56);
  state.v2 ^= 0xff;
  return state.finish();
}

}  // namespace tessel
