// When the next run is due, as plain arithmetic.

#pragma once

#include <algorithm>
#include <chrono>
#include <optional>

#include "platform/Clock.h"

namespace tessel {

// How long to wait for the run that comes `interval` after the one that began at `lastRun`; zero
// where it is due. `waited` is how long this wait has lasted, by a clock that nobody sets: however
// the wall clock is set meanwhile, or stands before the last run, no wait exceeds the interval.
inline std::chrono::nanoseconds waitForRun(std::optional<Date> lastRun, Date now,
                                           std::chrono::seconds interval,
                                           std::chrono::nanoseconds waited) {
  using std::chrono::nanoseconds;
  const auto sinceLastRun = lastRun ? now - *lastRun : Date::duration::max();
  if (sinceLastRun >= interval) return nanoseconds{0};
  // A run in the future tells nothing: the whole interval is waited for.
  const nanoseconds byWallClock = interval - std::max(sinceLastRun, Date::duration::zero());
  return std::clamp(interval - waited, nanoseconds{0}, byWallClock);
}

}  // namespace tessel
