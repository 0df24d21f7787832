// Damage to journal files, the same for the same seed, for tests only.

#pragma once

#include <cstdint>
#include <string>

namespace tessel::testing {

// A copy of `file` with one to eight faults: flipped bits, overwritten or zeroed stretches, a cut
// end, links and offsets that point elsewhere, sizes and counts that are too large.
std::string damaged(const std::string& file, uint64_t seed);

// Writes the word at an offset of a file that is held in memory.
void put(std::string& file, uint64_t at, uint64_t value);

}  // namespace tessel::testing
