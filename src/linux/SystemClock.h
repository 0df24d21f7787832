// SystemClock: the machine's clocks. Stateless; any thread.

#pragma once

#include "platform/Clock.h"

namespace tessel {

class SystemClock final : public Clock {
 public:
  // Nanoseconds since boot, time asleep included.
  uint64_t continuousTicks() override;
  Timebase timebase() override { return {1, 1}; }
  Date now() override;
  void sleepMicroseconds(uint32_t microseconds) override;
  bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) override;
};

}  // namespace tessel
