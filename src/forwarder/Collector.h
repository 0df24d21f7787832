// Where records go: the role Collector, and CurlCollector, which reaches one with HTTP.

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

// Collector: where records go, and what it answered.

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

// CurlCollector: a collector that is reached with HTTP, one connection kept open.
//
// The server's certificate is verified, redirects are not followed, and an answer is read for as
// long as the timeout allows but kept only up to kMaxAnswerBytes; one that goes on far beyond that
// is cut off, and its status counts.
//
// Threads: one at a time, but for cancel(). REQUIRES: curl_global_init() was called.

class CurlCollector final : public Collector {
 public:
  CurlCollector(const ForwarderSettings& settings, std::string_view contentType);
  CurlCollector(const CurlCollector&) = delete;
  CurlCollector& operator=(const CurlCollector&) = delete;
  ~CurlCollector() override;

  CollectorAnswer post(std::string_view body) override;
  // Ends the request under way and every later one without an answer. Any thread.
  void cancel() { cancelled_ = true; }

 private:
  struct Handles;

  const bool compress_;
  std::atomic<bool> cancelled_{false};
  std::unique_ptr<Handles> handles_;
};

}  // namespace tessel
