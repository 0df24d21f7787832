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
// firing may come late by up to the leeway. While an earlier firing waits on the queue, no further
// one is submitted: the handler would only run twice in a row. The timer goes on for as long as the
// process lives, even after its last reference is dropped.
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

// Runs `body` on a new thread that nobody joins. A system that has no thread to give may have one a
// moment later, so the call then waits and tries again.
void startThread(const Closure& body);
// The same, but false if the system had no thread to give for as long as `patience`.
bool startThread(const Closure& body, std::chrono::milliseconds patience);

// Where a queue gets its thread from.
enum class QueueThread {
  shared,  // one of the pool's, while the queue has work
  own,     // one that is made with the queue and serves no other
};

// A queue on threads. Nobody joins the threads, and the objects that they use are never destroyed.
// So the process may end at any moment; see Queues.cpp.
//
// The queues with QueueThread::shared have a pool of a few threads between them, and none while
// they have no work. An idle one costs a few hundred bytes. A closure on such a queue must not wait
// for another queue: if all threads of the pool waited, nothing would run any more. sync() asserts
// it. A queue with QueueThread::own always has its thread, so it waits for nobody else's work.
class WorkerQueue final : public SerialQueue {
 public:
  explicit WorkerQueue(std::string label, QueueThread thread = QueueThread::shared);
  WorkerQueue(const WorkerQueue&) = delete;
  WorkerQueue& operator=(const WorkerQueue&) = delete;
  ~WorkerQueue() override;

  const std::string& label() const override;
  void async(Closure work) override;
  void sync(const Closure& work) override;

  // Makes the first thread of the pool, which never ends.
  static void startPool();

 private:
  struct State;
  class Threads;
  static void runAll(State& state, std::unique_lock<std::mutex>& lock);
  static void serve(State& state);

  std::shared_ptr<State> state_;
};

// Makes queues that share the pool. All timers of the process share one thread, which only submits
// to queues. The constructor makes the threads that must exist before there is work.
class WorkerQueueFactory final : public QueueFactory {
 public:
  WorkerQueueFactory();
  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label) override;
  std::shared_ptr<RepeatingTimer> makeRepeatingTimer(std::shared_ptr<SerialQueue> queue,
                                                     std::chrono::nanoseconds interval,
                                                     std::chrono::nanoseconds leeway,
                                                     Closure handler) override;
};

}  // namespace tessel
