// The process runtime: keep-alive transactions, clean exit, signals, the main event loop.

#pragma once

#include <memory>
#include <string>

#include "platform/SerialQueue.h"

namespace tessel {

// While one is open the process is not ended as idle. Destroying it closes it.
class KeepAliveTransaction {
 public:
  virtual ~KeepAliveTransaction() = default;
};

// Delivers a signal as a closure on a queue. Made suspended.
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
  // Lets the process end with status 0 once no transaction is open and no delivery is pending.
  virtual void requestCleanExit() = 0;
  virtual std::shared_ptr<SignalSource> makeSignalSource(int signalNumber,
                                                         std::shared_ptr<SerialQueue> queue) = 0;
  [[noreturn]] virtual void runMainLoop() = 0;
};

}  // namespace tessel
