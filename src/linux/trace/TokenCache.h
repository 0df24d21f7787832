// TokenCache: which token a data object of which file has, remembered in a fixed amount of memory.
//
// One cache serves all files of a store, so its size depends neither on their number nor on theirs.
// A line of it covers one region of a file, with a word for every 64 bytes: no two data objects
// begin closer together. Values that recur were mostly first used close together, so the lines in
// use stay few. A region that falls out is asked for again.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <array>
#include <cstdint>
#include <vector>

#include "linux/trace/EntryStream.h"

namespace tessel {

class TokenCache {
 public:
  // Answered where nothing is remembered. No token has this value.
  static constexpr FieldToken kUnknown = UINT32_MAX;

  TokenCache() : lines_(kLines) {}

  // The token of the data object at `offset` of file `file`; kUnknown where it was not stored under
  // this generation of tokens.
  FieldToken find(uint32_t file, uint64_t offset, uint32_t generation) const {
    const uint64_t region = regionOf(file, offset);
    const Line& line = lines_[lineOf(region)];
    if (line.region != region || line.generation != generation) return kUnknown;
    return line.tokens[wordOf(offset)];
  }
  void store(uint32_t file, uint64_t offset, uint32_t generation, FieldToken token) {
    const uint64_t region = regionOf(file, offset);
    Line& line = lines_[lineOf(region)];
    if (line.region != region || line.generation != generation) {
      line.region = region;
      line.generation = generation;
      line.tokens.fill(kUnknown);
    }
    line.tokens[wordOf(offset)] = token;
  }

 private:
  static constexpr int kLineBits = 14;
  static constexpr size_t kLines = size_t{1} << kLineBits;
  static constexpr int kWordShift = 6;
  static constexpr size_t kWords = 64;
  static constexpr int kRegionShift = 12;
  static_assert(kWords << kWordShift == size_t{1} << kRegionShift);

  struct Line {
    uint64_t region = 0;
    uint32_t generation = 0;
    std::array<FieldToken, kWords> tokens;
  };

  // Never 0, so that an empty line is of no region.
  static uint64_t regionOf(uint32_t file, uint64_t offset) {
    return uint64_t{file + 1} << 50 | offset >> kRegionShift;
  }
  static size_t lineOf(uint64_t region) {
    return static_cast<size_t>(region * 0x9e3779b97f4a7c15u >> (64 - kLineBits));
  }
  static size_t wordOf(uint64_t offset) { return offset >> kWordShift & (kWords - 1); }

  std::vector<Line> lines_;
};

}  // namespace tessel
