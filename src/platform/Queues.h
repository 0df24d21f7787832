// Work on queues: the roles SerialQueue, RepeatingTimer and QueueFactory, their implementation on
// threads (standard library alone), and the semaphore to wait with.

#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

namespace tessel {

// A counting semaphore whose wait can time out. Any thread.
class Semaphore {
 public:
  explicit Semaphore(uint64_t count) : count_(count) {}

  void signal() {
    // Notify under the lock: as soon as the waiter gets the lock, it may destroy the semaphore.
    const std::lock_guard lock(mutex_);
    ++count_;
    condition_.notify_one();
  }
  // Takes one unit. False if none came within `timeout`, measured from the call.
  bool waitFor(std::chrono::nanoseconds timeout) {
    std::unique_lock lock(mutex_);
    if (!condition_.wait_for(lock, timeout, [this] { return count_ > 0; })) return false;
    --count_;
    return true;
  }

 private:
  std::mutex mutex_;
  std::condition_variable condition_;
  uint64_t count_;
};

using Closure = std::function<void()>;

// A first-in first-out queue. Any thread may submit closures. They run one at a time, in the order
// in which they were submitted. A queue still runs what it holds after its last reference is
// dropped.
class SerialQueue {
 public:
  virtual ~SerialQueue() = default;
  virtual const std::string& label() const = 0;
  // Returns at once. `work` runs later and is destroyed right after that.
  virtual void async(Closure work) = 0;
  // Returns after `work` has run. REQUIRES: not called on the queue itself, which would then wait
  // for itself for ever.
  virtual void sync(const Closure& work) = 0;
};

// A timer that submits its handler to a queue, once when it is resumed and then every interval. A
// firing may come late by up to the leeway. The timer goes on for as long as the process lives,
// even after its last reference is dropped.
class RepeatingTimer {
 public:
  virtual ~RepeatingTimer() = default;
  // Starts the timer; a second call does nothing.
  virtual void resume() = 0;
};

// Makes queues and timers.
class QueueFactory {
 public:
  virtual ~QueueFactory() = default;
  virtual std::shared_ptr<SerialQueue> makeSerialQueue(std::string label) = 0;
  virtual std::shared_ptr<RepeatingTimer> makeRepeatingTimer(std::shared_ptr<SerialQueue> queue,
                                                             std::chrono::nanoseconds interval,
                                                             std::chrono::nanoseconds leeway,
                                                             Closure handler) = 0;
};

// A queue on threads. It has a thread only while it has work, so an idle queue costs a few hundred
// bytes. Nobody joins the threads, and the objects that they use are never destroyed. So the
// process may end at any moment; see Queues.cpp.
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

// Makes queues on threads. All timers of the process share one thread, which only submits to
// queues.
class WorkerQueueFactory final : public QueueFactory {
 public:
  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label) override;
  std::shared_ptr<RepeatingTimer> makeRepeatingTimer(std::shared_ptr<SerialQueue> queue,
                                                     std::chrono::nanoseconds interval,
                                                     std::chrono::nanoseconds leeway,
                                                     Closure handler) override;
};

}  // namespace tessel
