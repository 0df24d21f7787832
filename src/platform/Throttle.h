// Throttle: paces what is sent to at most 10 events per 125,000 microseconds.
//
// Take a step before every send. Each tenth step closes a quantum and sleeps for what is left of
// its 125,000 microseconds. The other nine cost an increment and a comparison.
//
// One object serves the whole process, and its counters go on from run to run. Threads: one at a
// time. Callers follow one another, so it has no lock.

#pragma once

#include <cstdint>
#include <mutex>

#include "platform/System.h"

namespace tessel {

class Throttle {
 public:
  explicit Throttle(Clock& clock) : clock_(clock) {}

  // Takes one step. Sleeps on the caller's thread if the sends go too fast.
  void throttleReportedEvent();

  // Number of sleeps so far.
  uint64_t throttledCount() const { return throttledCount_; }
  // Microseconds slept so far.
  uint64_t throttledMicroseconds() const { return throttledMicroseconds_; }

 private:
  void setUp();
  void sleepForRestOfQuantum(double elapsedMicroseconds);

  Clock& clock_;
  std::once_flag firstUse_;
  double microsecondsPerMachUnit_ = 0;
  float quantumMicroseconds_ = 0;
  uint64_t eventsInQuantum_ = 0;
  uint64_t quantumStartTime_ = 0;
  uint64_t throttledCount_ = 0;
  uint64_t throttledMicroseconds_ = 0;
};

}  // namespace tessel
