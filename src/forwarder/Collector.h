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
  // No answer arrived although some of the body had been sent. A smaller request may get through:
  // the line may be slow, and some servers break the connection instead of answering 413.
  bool brokeWhileSending = false;
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
  // `settings` outlive the collector.
  CurlCollector(const ForwarderSettings& settings, std::string_view contentType);
  CurlCollector(const CurlCollector&) = delete;
  CurlCollector& operator=(const CurlCollector&) = delete;
  ~CurlCollector() override;

  // Reads the files of the credentials anew if one has changed since the last request.
  CollectorAnswer post(std::string_view body) override;
  // Whether the next request will do so.
  bool hasNewCredentials() const;
  // Ends the present request and every later one without an answer. Any thread.
  void cancel() { cancelled_ = true; }

 private:
  struct Handles;

  bool prepare();

  const ForwarderSettings& settings_;
  const std::string contentType_;
  std::atomic<bool> cancelled_{false};
  std::string credentialsSeen_;
  std::unique_ptr<Handles> handles_;
};

}  // namespace tessel
