// ProgressBar: says on standard error how far long work is.
//
// Appears where standard error is a terminal and the work takes more than a second, and leaves no
// trace when it is destroyed. One thread at a time.

#pragma once

#include <chrono>
#include <cstdint>

#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

class ProgressBar {
 public:
  // `wanted` is false where something else is written to the terminal meanwhile.
  explicit ProgressBar(bool wanted);
  ProgressBar(const ProgressBar&) = delete;
  ProgressBar& operator=(const ProgressBar&) = delete;
  ~ProgressBar() { clear(); }

  // `part` of the work, from 0 to 1, is done, with `entries` read.
  void update(double part, uint64_t entries);
  void clear();

 private:
  const bool wanted_;
  const Terminal terminal_;
  std::chrono::steady_clock::time_point nextLook_;
  bool visible_ = false;
};

}  // namespace tessel::ctl
