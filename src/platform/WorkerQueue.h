// WorkerQueue and WorkerQueueFactory: serial queues and timers on threads, standard library alone.
//
// A queue has a thread only while it has work, and an idle queue costs a few hundred bytes. A
// thread that has emptied its queue takes the next one that has work, and leaves where none comes
// within a moment; a queue that finds no idle thread gets a new one, so that no queue waits for
// another. All timers of the process share one thread, which does nothing but submit to queues.
// Threads are never joined, and what they use is never destroyed, so the process may end at any
// moment.

#pragma once

#include "platform/SerialQueue.h"

namespace tessel {

class WorkerQueue final : public SerialQueue {
 public:
  explicit WorkerQueue(std::string label);

  const std::string& label() const override;
  void async(Closure work) override;
  void sync(const Closure& work) override;

 private:
  struct State;
  class Threads;
  static void drain(State& state);

  std::shared_ptr<State> state_;
};

class WorkerQueueFactory final : public QueueFactory {
 public:
  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label) override;
  std::shared_ptr<RepeatingTimer> makeRepeatingTimer(std::shared_ptr<SerialQueue> queue,
                                                     std::chrono::nanoseconds interval,
                                                     std::chrono::nanoseconds leeway,
                                                     Closure handler) override;
};

}  // namespace tessel
