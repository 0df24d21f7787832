// Collector: where records go, and what it answered.

#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tessel {

struct CollectorAnswer {
  long status = 0;                                 // of HTTP; 0 where none arrived
  std::string body;                                // its beginning, kMaxAnswerBytes at most
  std::string error;                               // why no answer arrived, in words
  std::optional<std::chrono::seconds> retryAfter;  // what the collector asked for; never negative
  size_t bytesSent = 0;                            // of the request's body, as sent
};

class Collector {
 public:
  static constexpr size_t kMaxAnswerBytes = size_t{64} << 10;

  virtual ~Collector() = default;
  // Sends one request and waits for its answer, as long as the settings allow.
  virtual CollectorAnswer post(std::string_view body) = 0;
};

}  // namespace tessel
