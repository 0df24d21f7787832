// The life of the process.

#include "linux/ServiceRuntime.h"

#include <cstdlib>
#include <utility>

#include "linux/ThreadSignalSource.h"

namespace tessel {

// One unit of a counter of the runtime's.
class ServiceRuntime::Hold final : public KeepAliveTransaction {
 public:
  Hold(ServiceRuntime& runtime, size_t& counter) : runtime_(runtime), counter_(counter) {
    const std::lock_guard lock(runtime_.mutex_);
    ++counter_;
  }
  Hold(const Hold&) = delete;
  Hold& operator=(const Hold&) = delete;
  ~Hold() override {
    const std::lock_guard lock(runtime_.mutex_);
    --counter_;
    runtime_.changed_.notify_all();
  }

 private:
  ServiceRuntime& runtime_;
  size_t& counter_;
};

ServiceRuntime::ServiceRuntime(ServiceManager& manager) : manager_(manager) {}

std::unique_ptr<KeepAliveTransaction> ServiceRuntime::openTransaction(const std::string& /*name*/) {
  // Work starts with most of a watchdog period before it.
  manager_.progress();
  return std::make_unique<Hold>(*this, transactions_);
}

std::unique_ptr<KeepAliveTransaction> ServiceRuntime::expectDelivery() {
  return std::make_unique<Hold>(*this, deliveries_);
}

void ServiceRuntime::requestCleanExit() {
  const std::lock_guard lock(mutex_);
  cleanExitRequested_ = true;
  changed_.notify_all();
}

std::shared_ptr<SignalSource> ServiceRuntime::makeSignalSource(int signalNumber,
                                                               std::shared_ptr<SerialQueue> queue) {
  return std::make_shared<ThreadSignalSource>(signalNumber, std::move(queue));
}

bool ServiceRuntime::mayExit() const {
  const std::lock_guard lock(mutex_);
  return exitAllowed();
}

bool ServiceRuntime::exitAllowed() const {
  return cleanExitRequested_ && transactions_ == 0 && deliveries_ == 0;
}

void ServiceRuntime::waitUntilExitAllowed() {
  const std::chrono::nanoseconds feedInterval = manager_.feedInterval();
  std::unique_lock lock(mutex_);
  if (feedInterval.count() == 0) {
    changed_.wait(lock, [this] { return exitAllowed(); });
    return;
  }
  while (!changed_.wait_for(lock, feedInterval, [this] { return exitAllowed(); })) {
    if (transactions_ > 0) continue;
    lock.unlock();
    manager_.progress();
    lock.lock();
  }
}

void ServiceRuntime::runMainLoop() {
  manager_.ready();
  waitUntilExitAllowed();
  manager_.stopping();
  std::exit(0);
}

}  // namespace tessel
