// ServiceManager: readiness, status in words, and the watchdog, told to the service manager.
//
// Where no service manager listens every call is cheap and says nothing. Any thread may call. It
// lives as long as the process.

#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "platform/Clock.h"
#include "platform/ServiceStatus.h"

namespace tessel {

class ServiceManager final : public ServiceStatus {
 public:
  // Sends one message of the notification protocol: NAME=value lines.
  using Notify = std::function<void(const std::string& message)>;

  // `watchdog` is how long the manager waits for a sign of life; zero: it does not.
  ServiceManager(Clock& clock, Notify notify, std::chrono::nanoseconds watchdog);

  // The process is up.
  void ready();
  // The process is about to end.
  void stopping();
  // The same words again are not sent again. Counts as progress.
  void say(std::string_view words) override;
  // A sign of life, sent at most four times per watchdog period.
  void progress() override;
  // How often a process that has nothing to do should call progress(); zero: never.
  std::chrono::nanoseconds feedInterval() const { return feedInterval_; }

 private:
  bool takeFeed();

  Clock& clock_;
  const Notify notify_;
  const std::chrono::nanoseconds feedInterval_;
  std::atomic<uint64_t> nextFeed_{0};  // continuous ticks
  std::mutex wordsMutex_;
  std::string words_;
};

// The manager that the environment names ($NOTIFY_SOCKET, $WATCHDOG_USEC). `clock` must outlive it.
std::unique_ptr<ServiceManager> connectServiceManager(Clock& clock);

}  // namespace tessel
