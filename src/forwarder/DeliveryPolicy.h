// What an answer of a collector means, when to try again, and how fast to send. All of it is plain
// arithmetic, without a clock or a thread.

#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "forwarder/Collector.h"
#include "forwarder/Encoder.h"

namespace tessel {

enum class Verdict {
  accepted,  // a 2xx that is an answer of the protocol
  later,     // the collector cannot take anything now; a wait may help
  hold,      // the address, the credentials or the kind of the request is at fault
  refused,   // a record may be at fault
};

// `encoder` made the request that is answered.
Verdict verdictOn(const CollectorAnswer& answer, const Encoder& encoder);

// The status and the beginning of the body, or the error. One line that is fit for a terminal.
std::string answerWords(const CollectorAnswer& answer);

// How long to wait before one more attempt.
class Backoff {
 public:
  // `first` is the longest wait after the first failure. Each further failure doubles it up to
  // `most`.
  Backoff(std::chrono::milliseconds first, std::chrono::milliseconds most)
      : first_(first), most_(most) {}

  // The wait after a failure. `failures` counts the failures in a row, this one included. `chance`
  // is a new random number below 1 for each wait. Half of the wait is fixed and half is random, so
  // that a fleet that failed together does not come back together. If the collector asked for a
  // wait, we wait that long, up to an hour, and a random time more: it asked the whole fleet for
  // the same wait.
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
  // Takes note of a request with that many records, sent at `now`.
  void sent(uint64_t records, std::chrono::nanoseconds now);

 private:
  const uint64_t recordsPerSecond_;
  std::chrono::nanoseconds next_{0};
};

}  // namespace tessel
