// Work on queues: the roles SerialQueue, RepeatingTimer and QueueFactory, their implementation on
// threads, and the semaphore to wait with.

#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

namespace tessel {

// Semaphore: a counting semaphore whose wait can time out.

class Semaphore {
 public:
  explicit Semaphore(uint64_t count) : count_(count) {}

  void signal() {
    // Notified under the lock: the waiter may destroy the semaphore as soon as it has the lock.
    const std::lock_guard lock(mutex_);
    ++count_;
    condition_.notify_one();
  }
  // Takes one unit; false where none came within `timeout`, measured from the call.
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

// SerialQueue and RepeatingTimer: work that runs one piece at a time, in order of submission.

using Closure = std::function<void()>;

// A first-in first-out queue. What is submitted from any thread runs one closure at a time, each
// after all that was submitted before it. A queue that is dropped still runs what it holds.
class SerialQueue {
 public:
  virtual ~SerialQueue() = default;
  virtual const std::string& label() const = 0;
  // Returns at once; `work` runs later and is destroyed right after it ran.
  virtual void async(Closure work) = 0;
  // Returns when `work` has run. REQUIRES: not called from the queue itself.
  virtual void sync(const Closure& work) = 0;
};

// A timer that submits its handler to a queue: once when resumed and then every interval. A firing
// may come up to the leeway late. It goes on for as long as the process lives, also after the last
// reference to it was dropped.
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

// WorkerQueue and WorkerQueueFactory: serial queues and timers on threads, standard library alone.
//
// A queue has a thread only while it has work, and an idle queue costs a few hundred bytes. A
// thread that has emptied its queue takes the next one that has work, and leaves where none comes
// within a moment; a queue that finds no idle thread gets a new one, so that no queue waits for
// another. All timers of the process share one thread, which does nothing but submit to queues.
// Threads are never joined, and what they use is never destroyed, so the process may end at any
// moment.

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
