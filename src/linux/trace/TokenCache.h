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
#include <memory>

#include "linux/trace/EntryStream.h"

namespace tessel {

class TokenCache {
 private:
  static constexpr int kLineBits = 14;
  static constexpr size_t kLines = size_t{1} << kLineBits;
  static constexpr int kWordShift = 6;
  static constexpr size_t kWords = 64;
  static constexpr int kRegionShift = 12;
  static constexpr int kFileShift = 50;
  static_assert(kWords << kWordShift == size_t{1} << kRegionShift);
  using Line = std::array<FieldToken, kWords>;

 public:
  // No file is as large as that; greater offsets would be taken for those of other files.
  static constexpr uint64_t kMaxOffset = (uint64_t{1} << (kFileShift + kRegionShift)) - 1;
  // Answered where nothing is remembered. No token has this value.
  static constexpr FieldToken kUnknown = UINT32_MAX;

  TokenCache()
      : regions_(std::make_unique<uint64_t[]>(kLines)),
        lines_(std::make_unique_for_overwrite<Line[]>(kLines)) {}

  // Forgets everything where what it remembers is of another generation of tokens.
  void useGeneration(uint32_t generation) {
    if (generation == generation_) [[likely]]
      return;
    generation_ = generation;
    std::fill_n(regions_.get(), kLines, 0);
  }

  // What is remembered of one file. Valid while the cache lives, and small enough to be made for
  // every entry.
  class OfFile {
   public:
    OfFile(TokenCache& cache, uint32_t file)
        : regions_(cache.regions_.get()),
          lines_(cache.lines_.get()),
          file_(uint64_t{file + 1} << kFileShift) {}

    // The token of the data object at `offset`, at most kMaxOffset; kUnknown where it is not
    // remembered.
    FieldToken find(uint64_t offset) const {
      const uint64_t region = regionOf(offset);
      const size_t line = lineOf(region);
      return regions_[line] == region ? lines_[line][wordOf(offset)] : kUnknown;
    }
    void store(uint64_t offset, FieldToken token) {
      const uint64_t region = regionOf(offset);
      const size_t line = lineOf(region);
      if (regions_[line] != region) {
        regions_[line] = region;
        lines_[line].fill(kUnknown);
      }
      lines_[line][wordOf(offset)] = token;
    }

   private:
    // Never 0, so that an empty line is of no region.
    uint64_t regionOf(uint64_t offset) const { return file_ | offset >> kRegionShift; }

    uint64_t* regions_;
    Line* lines_;
    uint64_t file_;
  };

 private:
  static size_t lineOf(uint64_t region) {
    return static_cast<size_t>(region * 0x9e3779b97f4a7c15u >> (64 - kLineBits));
  }
  static size_t wordOf(uint64_t offset) { return offset >> kWordShift & (kWords - 1); }

  uint32_t generation_ = 0;
  // Of each line; apart from them, as a lookup reads this first.
  const std::unique_ptr<uint64_t[]> regions_;
  const std::unique_ptr<Line[]> lines_;  // a line has its words from when it has a region
};

}  // namespace tessel
