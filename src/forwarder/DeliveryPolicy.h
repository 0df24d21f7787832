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
// Whether the status says that the content of the request is bad. A collector that is overloaded or
// broken does not answer so.
bool isAboutContent(const CollectorAnswer& answer);
inline constexpr long kContentTooLarge = 413;

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

// How many bytes of records to put into a request. A collector may have a limit that nobody told
// us, and a slow line may not carry a large request in time.
class BatchSize {
 public:
  // Begins with `most` bytes, which is also the largest size.
  explicit BatchSize(size_t most) : most_(most), bytes_(most) {}

  size_t bytes() const { return bytes_; }
  // A request with so many bytes of records was too large, or took too long.
  void tooMuch(size_t bytes);
  // A request with so many bytes was accepted.
  void taken(size_t bytes);

 private:
  const size_t most_;
  size_t bytes_;
  uint32_t taken_ = 0;     // full requests since the last change
  uint32_t patience_ = 1;  // so many before a larger one is tried
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
