// What an answer means, when to try again, how fast to go: plain arithmetic without clock or
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
  later,     // the same again after a while: 429, 502, 503, 504, no answer
  hold,      // no record is at fault, but address or credentials: 3xx, 401, 403, 404, 405, 407
  refused,   // at least one of the records is at fault: anything else
};

Verdict verdictOn(const CollectorAnswer& answer);

// Status and the beginning of the body, or the error, in one line that is fit for a terminal.
std::string answerWords(const CollectorAnswer& answer);

// How long to wait before one more attempt.
class Backoff {
 public:
  // `first` is the wait after the first failure, at most; each further one doubles it up to `most`.
  Backoff(std::chrono::milliseconds first, std::chrono::milliseconds most)
      : first_(first), most_(most) {}

  // The wait after the `failures`-th failure in a row, counted from 1. `chance` is drawn anew from
  // [0, 1): half the wait is certain and half is chance, so that a fleet that failed together does
  // not come back together. Where the collector asked for a wait, that counts instead, up to an
  // hour, and chance comes on top: the whole fleet was asked for the same.
  std::chrono::milliseconds wait(uint32_t failures, double chance,
                                 std::optional<std::chrono::seconds> asked) const;

 private:
  const std::chrono::milliseconds first_;
  const std::chrono::milliseconds most_;
};

// Keeps to a number of records a second.
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
