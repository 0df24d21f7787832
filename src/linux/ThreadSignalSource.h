// ThreadSignalSource: a signal source with a thread that waits for its signal.
//
// The signal must be blocked in every thread, which blockSignal() sees to when it is called before
// the first one starts: it then stays pending until the source is resumed, and is delivered to the
// queue and nowhere else. Setting the handler and resuming are for one thread; once resumed, the
// source delivers for as long as the process lives, also after its last reference was dropped.

#pragma once

#include <memory>

#include "platform/Runtime.h"

namespace tessel {

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

}  // namespace tessel
