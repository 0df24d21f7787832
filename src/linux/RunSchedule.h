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
  if (!lastRun) return nanoseconds{0};
  const nanoseconds longest = nanoseconds{interval} - waited;
  if (*lastRun > now) return std::max(longest, nanoseconds{0});
  if (now - *lastRun >= interval) return nanoseconds{0};
  return std::clamp(nanoseconds{interval} - nanoseconds{now - *lastRun}, nanoseconds{0},
                    std::max(longest, nanoseconds{0}));
}

}  // namespace tessel
