// The arithmetic of pacing: Throttle, the one part of Analytics.h with a body.
//
// The bound protects the receiver of the events: 10 in 125 ms are 80 a second. Each quantum begins
// anew and carries no unused time over. Otherwise a burst would follow each quiet time.

#include "platform/Analytics.h"

#include "platform/Log.h"

namespace tessel {

void Throttle::setUp() {
  const Timebase timebase = clock_.timebase();
  // The first step calls this, and not the constructor, so that the first quantum begins with the
  // first send.
  microsecondsPerMachUnit_ =
      static_cast<double>(timebase.numerator) / static_cast<double>(timebase.denominator) / 1000.0;
  quantumMicroseconds_ = 125000.0f;
  const double quantum = static_cast<double>(quantumMicroseconds_);
  tesselReporterLog().debug("%f us, %f mach time units per quantum of %u reported events", quantum,
                            quantum / microsecondsPerMachUnit_, kStepsPerQuantum);
  quantumStartTime_ = clock_.continuousTicks();
}

void Throttle::throttleReportedEvent() {
  std::call_once(firstUse_, [this] { setUp(); });
  ++eventsInQuantum_;
  if (eventsInQuantum_ < kStepsPerQuantum) return;
  const uint64_t now = clock_.continuousTicks();
  sleepForRestOfQuantum(static_cast<double>(now - quantumStartTime_) * microsecondsPerMachUnit_);
  eventsInQuantum_ = 0;
  ++quantaClosed_;
  // Read after the sleep, so that the sleep does not count for the next quantum.
  quantumStartTime_ = clock_.continuousTicks();
  sleptTicks_ += quantumStartTime_ - now;
}

void Throttle::sleepForRestOfQuantum(double elapsedMicroseconds) {
  const double quantum = static_cast<double>(quantumMicroseconds_);
  // A timebase with denominator 0 can make this NaN. A NaN is not less than anything, so it
  // returns.
  if (!(elapsedMicroseconds < quantum)) return;
  const auto sleep = static_cast<uint32_t>(quantum - elapsedMicroseconds);
  tesselReporterLog().debug("Sleeping for %u us", sleep);
  threads_.sleep(std::chrono::microseconds{sleep});
  throttledMicroseconds_ += sleep;
  ++throttledCount_;
}

}  // namespace tessel
