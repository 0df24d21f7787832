// StoreReport: what the reader of a journal store knows about what it read and what it could not.
//
// Plain values. A report is filled by the one thread that reads and copied out for others.

#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Losses.h"

namespace tessel {

struct FileReport {
  std::string path;
  uint64_t entriesRead = 0;            // of those in the range
  std::optional<std::string> skipped;  // why the file was not read; absent if it was
  bool outsideRange = false;           // skipped, without harm: it has no entry of the range
  bool notThere = false;               // skipped, without harm: already removed, or not yet written
  bool refused = false;                // skipped: this user may not read it
  Losses problems;                     // damage; the places are offsets in this file

  // `offset` is the byte where the damage was met. Not inlined: whoever makes strings on the stack
  // has to check the stack at its end, and that would be every function that may meet damage.
  [[gnu::noinline]] void addProblem(std::string_view reason, uint64_t offset, uint64_t count = 1) {
    problems.add(LossCode::fileDamaged, reason, {{}, offset}, count);
  }
};

struct StoreReport {
  StoreReading reading;
  std::vector<FileReport> files;
};

}  // namespace tessel
