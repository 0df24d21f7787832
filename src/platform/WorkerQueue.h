// WorkerQueue and WorkerQueueFactory: serial queues and timers on threads, standard library alone.
//
// A queue has a thread only while it has work: the thread comes with the first closure and leaves
// a moment after the last of it, so that an idle queue costs a few hundred bytes. All timers of the
// process share one thread, which does nothing but submit to queues. Threads are never joined, and
// what they use is never destroyed, so the process may end at any moment.

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
  static void drain(const std::shared_ptr<State>& state);

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
