// CurlCollector: a collector that is reached with HTTP, one connection kept open.
//
// The server's certificate is verified, redirects are not followed, and an answer is read for as
// long as the timeout allows but kept only up to kMaxAnswerBytes; one that goes on far beyond that
// is cut off, and its status counts.
//
// Threads: one at a time, but for cancel(). REQUIRES: curl_global_init() was called.

#pragma once

#include <atomic>
#include <memory>

#include "forwarder/Collector.h"
#include "forwarder/Settings.h"

namespace tessel {

class CurlCollector final : public Collector {
 public:
  explicit CurlCollector(const ForwarderSettings& settings);
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
