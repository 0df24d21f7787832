// Clock: ticks that keep counting during sleep, the wall clock, and waiting.

#pragma once

#include <chrono>
#include <cstdint>

#include "platform/Semaphore.h"

namespace tessel {

// Wall-clock date, microseconds since 1970, UTC.
using Date = std::chrono::sys_time<std::chrono::microseconds>;

// Nanoseconds per tick, as a fraction.
struct Timebase {
  uint32_t numerator;
  uint32_t denominator;
};

class Clock {
 public:
  virtual ~Clock() = default;
  // Native ticks of the monotonic clock that keeps counting while the machine sleeps.
  virtual uint64_t continuousTicks() = 0;
  virtual Timebase timebase() = 0;
  virtual Date now() = 0;
  virtual void sleepMicroseconds(uint32_t microseconds) = 0;
  // Waits on `semaphore`; false where it timed out, `timeout` after the call.
  virtual bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) = 0;
};

}  // namespace tessel
