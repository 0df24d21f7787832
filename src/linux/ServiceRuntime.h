// The process: its setup, its signals, its word with the service manager, and how long it lives.

#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "platform/System.h"

namespace tessel {

// What the process owes its platform before anything else runs.

// Call first in main(), before any thread exists:
//  - blocks SIGINT, in this thread and in every later one, so that an interrupt waits for its
//    signal source instead of ending the process by the signal;
//  - ignores SIGPIPE: a reader of the log that went away is no reason to end;
//  - opens /dev/null for each standard descriptor that is closed, so that no file that is opened
//    later takes its number and receives log lines;
//  - has the heap give large blocks back, so that a process that stays does not hold between two
//    runs what the last one took.
void prepareProcess();

// Blocks `signalNumber` in the calling thread and in those that it starts.
void blockSignal(int signalNumber);

// ServiceManager: readiness, status in words, and the watchdog, told to the service manager.
//
// Where no service manager listens every call is cheap and says nothing. Any thread may call. It
// lives as long as the process.

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

// ThreadSignalSource: a signal source with a thread that waits for its signal.
//
// The signal must be blocked in every thread, which blockSignal() sees to when it is called before
// the first one starts: it then stays pending until the source is resumed, and is delivered to the
// queue and nowhere else. Setting the handler and resuming are for one thread; once resumed, the
// source delivers for as long as the process lives, also after its last reference was dropped.

class ThreadSignalSource final : public SignalSource {
 public:
  // REQUIRES: `signalNumber` is blocked in every thread of the process.
  ThreadSignalSource(int signalNumber, std::shared_ptr<SerialQueue> queue);

  void setHandler(Closure handler) override;
  // Starts delivery; a second call does nothing. REQUIRES: a handler is set.
  void resume() override;

 private:
  const int signalNumber_;
  std::shared_ptr<SerialQueue> queue_;
  Closure handler_;
};

// ServiceRuntime: how long the process lives.
//
// The process ends with status 0 when a clean exit was requested, no keep-alive transaction is open
// and no delivery is pending. A request stays in force until then. Any thread may call; the runtime
// must outlive every transaction, so it lives as long as the process.

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
