// Throttle: paces what is sent to at most 10 events per 125,000 microseconds.
//
// Every send is preceded by one throttle step. Each tenth step closes a quantum: where the quantum
// was shorter than 125,000 microseconds, the step sleeps for the rest. The other nine are an
// increment and a comparison.
//
// One object serves the whole process, and its counters carry over from run to run. Threads: one
// at a time; callers follow one another, so there is no lock.

#pragma once

#include <cstdint>
#include <mutex>

#include "platform/System.h"

namespace tessel {

class Throttle {
 public:
  explicit Throttle(Clock& clock) : clock_(clock) {}

  // One step; sleeps on the caller's thread where the sends go too fast.
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
