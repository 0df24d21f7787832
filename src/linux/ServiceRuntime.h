// The process: its setup, its signals, its messages to the service manager, and how long it lives.

#pragma once

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "platform/System.h"

namespace tessel {

// Prepares the process. Call it first in main(), before any thread exists. It
//  - blocks SIGINT in this thread and in all later ones, so that an interrupt waits for its signal
//    source and does not kill the process;
//  - ignores SIGPIPE, because a log reader that went away is no reason to end, and SIGXFSZ, because
//    a file that may not grow is an error of a write like any other;
//  - opens /dev/null for each standard descriptor that is closed. Otherwise a file that is opened
//    later would get that number and receive log lines;
//  - makes the heap give large blocks back, so that an idle process does not keep the memory of its
//    last run.
void prepareProcess();

// Blocks `signalNumber` in the calling thread and in those that it starts.
void blockSignal(int signalNumber);

// Tells the service manager about readiness, status and signs of life. If no manager listens,
// every call is cheap and does nothing. Any thread may call. It lives as long as the process.
class ServiceManager final : public ServiceStatus {
 public:
  // Sends one message of the notification protocol: NAME=value lines.
  using Notify = std::function<void(const std::string& message)>;

  // `watchdog` is how long the manager waits for a sign of life before it kills the process; zero
  // if it does not watch.
  ServiceManager(Clock& clock, Notify notify, std::chrono::nanoseconds watchdog);

  // The process is up.
  void ready();
  // The process is about to end.
  void stopping();
  // Sends the words, unless the last call had the same words. Counts as progress.
  void say(std::string_view words) override;
  // Sends a sign of life, at most four times per watchdog period.
  void progress() override;
  // Sends one in the place of work that waits, for a slow disk for example. It does so only for a
  // minute after the last progress(). A wait that never ends then ends in the watchdog.
  void standInForProgress();
  // How often a process that has nothing to do should call progress(). Zero: never.
  std::chrono::nanoseconds feedInterval() const { return feedInterval_; }

 private:
  uint64_t ticksOf(std::chrono::nanoseconds time) const;
  void feed(uint64_t now);

  Clock& clock_;
  const Notify notify_;
  const std::chrono::nanoseconds feedInterval_;
  std::atomic<uint64_t> lastProgress_{0};  // continuous ticks
  std::atomic<uint64_t> nextFeed_{0};      // continuous ticks
  std::mutex wordsMutex_;
  std::string words_;
};

// The manager that the environment names ($NOTIFY_SOCKET, $WATCHDOG_USEC). `clock` must outlive it.
std::unique_ptr<ServiceManager> connectServiceManager(Clock& clock);

// A signal source with a thread that waits for its signal. A signal that arrives before the source
// is resumed stays pending and is delivered then. The source delivers for as long as the process
// lives, even after its last reference is dropped. Threads: one sets the handler and resumes.
class ThreadSignalSource final : public SignalSource {
 public:
  // REQUIRES: `signalNumber` is blocked in every thread of the process. Call blockSignal() before
  // the first thread starts.
  ThreadSignalSource(int signalNumber, std::shared_ptr<SerialQueue> queue, Threads& threads);

  void setHandler(Closure handler) override;
  // Starts the delivery. A second call does nothing. REQUIRES: a handler is set.
  void resume() override;

 private:
  const int signalNumber_;
  std::shared_ptr<SerialQueue> queue_;
  Threads& threads_;
  Closure handler_;
};

// Decides how long the process lives. It ends with status 0 as soon as somebody has requested a
// clean exit, no keep-alive transaction is open and no delivery is pending. Any thread may call.
// The runtime outlives every transaction, so it lives as long as the process.
class ServiceRuntime final : public Runtime {
 public:
  // `manager` and `threads` must outlive the runtime.
  ServiceRuntime(ServiceManager& manager, Threads& threads);

  std::unique_ptr<KeepAliveTransaction> openTransaction(const std::string& name) override;
  void requestCleanExit() override;
  // Makes a ThreadSignalSource; see there for what it requires.
  std::shared_ptr<SignalSource> makeSignalSource(int signalNumber,
                                                 std::shared_ptr<SerialQueue> queue) override;
  // Tells the manager that the process is ready, waits until it may end, and ends it. While no
  // transaction is open, this loop sends the signs of life. While one is open, its work sends them,
  // and this loop only stands in: otherwise a run that hangs would look alive.
  [[noreturn]] void runMainLoop() override;
  // The same, but returns when the process may end.
  void serve();

  // Keeps the process alive until the result is destroyed, because a delivery is pending. Unlike a
  // transaction it does not mean that work is under way.
  std::unique_ptr<KeepAliveTransaction> expectDelivery();
  // Whether the main loop would end the process now.
  bool mayExit() const;

 private:
  class Hold;

  void waitUntilExitAllowed();
  bool exitAllowed() const;

  ServiceManager& manager_;
  Threads& threads_;
  mutable std::mutex mutex_;
  Semaphore changed_{0};  // has a unit for each change that the main loop has not looked at yet
  size_t transactions_ = 0;
  size_t deliveries_ = 0;
  bool cleanExitRequested_ = false;
};

}  // namespace tessel
