// What the service asks of whoever runs it: the activity scheduler, the process runtime, the
// service manager.

#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "platform/Queues.h"

namespace tessel {

// Activity states, as the scheduler numbers them.
inline constexpr int64_t kActivityStateCheckIn = 0;
inline constexpr int64_t kActivityStateRun = 2;
inline constexpr int64_t kActivityStateDefer = 3;

// One registered activity. Any thread may ask.
class Activity {
 public:
  virtual ~Activity() = default;
  virtual int64_t state() = 0;
  // Whether the scheduler wants the activity to give its slot back.
  virtual bool shouldDefer() = 0;
  // False if the scheduler does not take the state.
  virtual bool setState(int64_t state) = 0;
};

using ActivityHandler = std::function<void(const std::shared_ptr<Activity>&)>;

class ActivityScheduler {
 public:
  virtual ~ActivityScheduler() = default;
  // Registers for check-in, with the criteria of the launch configuration. The scheduler calls the
  // handler on a thread of its own, never twice at a time.
  virtual void registerActivity(const std::string& name, ActivityHandler handler) = 0;
};

// While a transaction is open, the process is not ended as idle. Destroying the object closes it.
class KeepAliveTransaction {
 public:
  virtual ~KeepAliveTransaction() = default;
};

// Delivers a signal as a closure on a queue. It delivers nothing until it is resumed.
class SignalSource {
 public:
  virtual ~SignalSource() = default;
  virtual void setHandler(Closure handler) = 0;
  virtual void resume() = 0;
};

class Runtime {
 public:
  virtual ~Runtime() = default;
  virtual std::unique_ptr<KeepAliveTransaction> openTransaction(const std::string& name) = 0;
  // Lets the process end with status 0 as soon as no transaction is open and no delivery is
  // pending.
  virtual void requestCleanExit() = 0;
  virtual std::shared_ptr<SignalSource> makeSignalSource(int signalNumber,
                                                         std::shared_ptr<SerialQueue> queue) = 0;
  [[noreturn]] virtual void runMainLoop() = 0;
};

// Tells the service manager what the process is doing and that it makes progress. Any thread.
class ServiceStatus {
 public:
  virtual ~ServiceStatus() = default;
  // What the process is doing now, in a few words for a human: "reading the trace store".
  virtual void say(std::string_view words) = 0;
  // Says that work moved on by a step. Cheap enough for every trace object: most calls only read a
  // clock. If a process that works does not call it within its watchdog period, the manager takes
  // the process for hung and kills it.
  virtual void progress() = 0;
};

}  // namespace tessel
