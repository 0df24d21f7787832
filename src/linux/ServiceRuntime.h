// ServiceRuntime: how long the process lives.
//
// The process ends with status 0 when a clean exit was requested, no keep-alive transaction is open
// and no delivery is pending. A request stays in force until then. Any thread may call; the runtime
// must outlive every transaction, so it lives as long as the process.

#pragma once

#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>

#include "linux/ServiceManager.h"
#include "platform/Runtime.h"

namespace tessel {

class ServiceRuntime final : public Runtime {
 public:
  // `manager` must outlive the runtime.
  explicit ServiceRuntime(ServiceManager& manager);

  std::unique_ptr<KeepAliveTransaction> openTransaction(const std::string& name) override;
  void requestCleanExit() override;
  // A source on a thread of its own; see ThreadSignalSource for what it requires.
  std::shared_ptr<SignalSource> makeSignalSource(int signalNumber,
                                                 std::shared_ptr<SerialQueue> queue) override;
  // Tells the manager that the process is ready, waits until it may end, and ends it. While no
  // transaction is open the loop keeps the watchdog content; while one is, its work has to.
  [[noreturn]] void runMainLoop() override;

  // Keeps the process alive while a delivery is pending, until the result is destroyed. Unlike a
  // transaction it is no sign of work under way.
  std::unique_ptr<KeepAliveTransaction> expectDelivery();
  // Whether the main loop would end the process now.
  bool mayExit() const;

 private:
  class Hold;

  void waitUntilExitAllowed();
  bool exitAllowed() const;

  ServiceManager& manager_;
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  size_t transactions_ = 0;
  size_t deliveries_ = 0;
  bool cleanExitRequested_ = false;
};

}  // namespace tessel
