// Where records go: the role Collector, and CurlCollector, which sends to a collector over HTTP.

#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "forwarder/Settings.h"

namespace tessel {

struct CollectorAnswer {
  long status = 0;                                 // of HTTP; 0 if no answer arrived
  std::string mediaType;                           // of the body, see Encoder::readSuccess()
  std::string body;                                // all of it, at most kMaxAnswerBytes
  std::string error;                               // why no answer arrived, in words
  std::optional<std::chrono::seconds> retryAfter;  // the wait that the collector asks for, positive
  size_t bytesSent = 0;                            // of the request's body, after compression
};

class Collector {
 public:
  // The most that the protocol lets a client read of an answer.
  static constexpr size_t kMaxAnswerBytes = size_t{4} << 20;

  virtual ~Collector() = default;
  // Sends one request and waits for its answer for as long as the settings allow.
  virtual CollectorAnswer post(std::string_view body) = 0;
};

// Sends with HTTP over a connection that stays open. It verifies the server's certificate and
// follows no redirect. A success counts only if the answer arrived whole, from its head to the end
// of its body. Of another answer the status is enough.
//
// Threads: one at a time, except for cancel(). REQUIRES: curl_global_init() was called.
class CurlCollector final : public Collector {
 public:
  CurlCollector(const ForwarderSettings& settings, std::string_view contentType);
  CurlCollector(const CurlCollector&) = delete;
  CurlCollector& operator=(const CurlCollector&) = delete;
  ~CurlCollector() override;

  CollectorAnswer post(std::string_view body) override;
  // Ends the present request and every later one without an answer. Any thread.
  void cancel() { cancelled_ = true; }

 private:
  struct Handles;

  const bool compress_;
  std::atomic<bool> cancelled_{false};
  std::unique_ptr<Handles> handles_;
};

}  // namespace tessel
