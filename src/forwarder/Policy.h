// What an answer means, when to try again, and how fast to send. Plain arithmetic without clock or
// thread.

#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>

#include "forwarder/Collector.h"

namespace tessel {

enum class Verdict {
  accepted,  // any 2xx
  later,     // send the same again after a while: 429, 502, 503, 504, no answer
  hold,      // the address or the credentials are at fault: 3xx, 401, 403, 404, 405, 407
  refused,   // at least one record is at fault: anything else
};

Verdict verdictOn(const CollectorAnswer& answer);

// The status and the beginning of the body, or the error. One line that is fit for a terminal.
std::string answerWords(const CollectorAnswer& answer);

// How long to wait before one more attempt.
class Backoff {
 public:
  // `first` is the longest wait after the first failure. Each further failure doubles it up to
  // `most`.
  Backoff(std::chrono::milliseconds first, std::chrono::milliseconds most)
      : first_(first), most_(most) {}

  // The wait after the `failures`-th failure in a row, counted from 1. `chance` is drawn from [0,
  // 1) for each wait. Half of the wait is certain and half is chance, so that a fleet that failed
  // together does not come back together. If the collector asked for a wait, that one counts, up to
  // an hour, and chance is added to it, because it asked the whole fleet for the same.
  std::chrono::milliseconds wait(uint32_t failures, double chance,
                                 std::optional<std::chrono::seconds> asked) const;

 private:
  const std::chrono::milliseconds first_;
  const std::chrono::milliseconds most_;
};

// Keeps to a number of records per second.
class Pace {
 public:
  // Zero: no limit.
  explicit Pace(uint64_t recordsPerSecond) : recordsPerSecond_(recordsPerSecond) {}

  // How long to wait at `now` before the next request.
  std::chrono::nanoseconds waitAt(std::chrono::nanoseconds now) const;
  // Takes note of a request with `records` that is sent at `now`.
  void sent(uint64_t records, std::chrono::nanoseconds now);

 private:
  const uint64_t recordsPerSecond_;
  std::chrono::nanoseconds next_{0};
};

}  // namespace tessel
