// Work on queues: the roles SerialQueue, RepeatingTimer and QueueFactory, and their implementation
// on threads.

#pragma once

#include <chrono>
#include <memory>
#include <mutex>
#include <string>

#include "platform/Threads.h"

namespace tessel {

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

// A few threads that queues share. Each has one while it has work, and none otherwise, so an idle
// queue costs a few hundred bytes. Its threads go on after the pool is gone. Any thread.
class ThreadPool {
 public:
  // Makes the first thread, which never ends.
  explicit ThreadPool(Threads& threads);

  // Whether the calling thread is one of a pool. Whoever runs several threads of this kind on one
  // of the system's keeps the flag for each.
  static bool& ownsThisThread();

 private:
  friend class WorkerQueue;
  class Members;
  Members& members_;
};

// A queue on threads. Nobody joins the threads, and the objects that they use are never destroyed.
// So the process may end at any moment; see Queues.cpp.
//
// A closure on a queue of the pool must not wait for another queue: if all threads of the pool
// waited, nothing would run any more. sync() asserts it. A queue with a thread of its own waits for
// nobody else's work.
class WorkerQueue final : public SerialQueue {
 public:
  // A queue that shares the pool.
  WorkerQueue(std::string label, ThreadPool& pool);
  // A queue with a thread of its own, which is made here and serves no other queue.
  WorkerQueue(std::string label, Threads& threads);
  WorkerQueue(const WorkerQueue&) = delete;
  WorkerQueue& operator=(const WorkerQueue&) = delete;
  ~WorkerQueue() override;

  const std::string& label() const override;
  void async(Closure work) override;
  void sync(const Closure& work) override;

 private:
  friend class ThreadPool::Members;
  struct State;
  static void runAll(State& state, std::unique_lock<std::mutex>& lock);
  static void drain(State& state);
  static void serve(State& state);

  std::shared_ptr<State> state_;
};

// Makes queues that share a pool. All its timers share one thread, which only submits to queues.
// The constructor makes the threads that must exist before there is work. They go on for as long as
// the process lives, even after the factory is gone.
class WorkerQueueFactory final : public QueueFactory {
 public:
  explicit WorkerQueueFactory(Threads& threads);
  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label) override;
  std::shared_ptr<RepeatingTimer> makeRepeatingTimer(std::shared_ptr<SerialQueue> queue,
                                                     std::chrono::nanoseconds interval,
                                                     std::chrono::nanoseconds leeway,
                                                     Closure handler) override;

 private:
  class TimerThread;
  class SharedThreadTimer;

  ThreadPool pool_;
  TimerThread& timers_;
};

}  // namespace tessel
