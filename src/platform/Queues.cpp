// Queues and timers on threads.
//
// Threads exist only while there is work. A queue that gets work takes an idle thread, or a new one
// if none is idle; a thread that has emptied its queue serves the next, and ends if none comes
// within a moment. The service has half a dozen queues and sleeps for a day between two runs: a
// thread for each would cost a stack and a wakeup for nothing. A pool of fixed size was discarded,
// because a queue may wait for another (sync), and a full pool would then wait for ever.
//
// Every thread is detached. To join them at the end, the process would have to wait for closures
// that may sleep for long (the throttle) or wait for something that will not come.
//
// So exit(0) may meet threads that are still running. The C library then destroys the objects with
// static storage while those threads go on. Whatever they touch (Threads, TimerThread, the sink of
// the log) is made by `new` and never deleted; a queue's state lives as long as the thread that
// works on it. An unfinished closure ends with the process, which its work must allow: the spool
// loses no row by it, and a run leaves its marker.

#include "platform/Queues.h"

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <list>
#include <mutex>
#include <queue>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Invariant.h"

namespace tessel {

namespace {
// An idle thread waits this long for work. A run submits its closures within microseconds of each
// other, so one thread serves them all; and 20 ms later an idle process has none of them left.
constexpr std::chrono::milliseconds kIdleThreadLife{20};
}  // namespace

struct WorkerQueue::State {
  explicit State(std::string name) : label(std::move(name)) {}

  const std::string label;
  std::mutex mutex;
  std::list<Closure> work;  // a list, because an empty one has nothing on the heap
  bool hasThread = false;   // or will have one soon
  bool working = false;     // a closure is running
};

// The threads of all queues.
class WorkerQueue::Threads {
 public:
  static Threads& shared() {
    static Threads& instance = *new Threads;
    return instance;
  }

  void take(std::shared_ptr<State> queue) {
    const std::lock_guard lock(mutex_);
    waiting_.push_back(std::move(queue));
    if (idle_ >= waiting_.size()) {
      arrived_.notify_one();
      return;
    }
    // Start the thread under the lock, which it needs before it can end. detach() reads the
    // thread's memory, and a thread that ended before would have given it back already.
    std::thread([this] { run(); }).detach();
  }

 private:
  void run() {
    std::unique_lock lock(mutex_);
    while (waitForQueue(lock)) {
      const std::shared_ptr<State> queue = std::move(waiting_.front());
      waiting_.pop_front();
      lock.unlock();
      drain(*queue);
      lock.lock();
    }
  }

  bool waitForQueue(std::unique_lock<std::mutex>& lock) {
    ++idle_;
    const bool came =
        arrived_.wait_for(lock, kIdleThreadLife, [this] { return !waiting_.empty(); });
    --idle_;
    return came;
  }

  std::mutex mutex_;
  std::condition_variable arrived_;
  std::deque<std::shared_ptr<State>> waiting_;
  size_t idle_ = 0;
};

WorkerQueue::WorkerQueue(std::string label) : state_(std::make_shared<State>(std::move(label))) {}

const std::string& WorkerQueue::label() const { return state_->label; }

void WorkerQueue::async(Closure work) {
  {
    const std::lock_guard lock(state_->mutex);
    state_->work.push_back(std::move(work));
    if (std::exchange(state_->hasThread, true)) return;
  }
  Threads::shared().take(state_);
}

void WorkerQueue::sync(const Closure& work) {
  Semaphore done(0);
  async([&work, &done] {
    work();
    done.signal();
  });
  while (!done.waitFor(std::chrono::hours(1))) {
  }
}

// Runs everything that the queue holds. `hasThread` lets only one thread in, and that is what makes
// the queue serial; each closure is destroyed before the next begins.
void WorkerQueue::drain(State& state) {
  std::unique_lock lock(state.mutex);
  while (!state.work.empty()) {
    Closure work = std::move(state.work.front());
    state.work.pop_front();
    // One at a time: the code of the service relies on it in place of locks.
    TESSEL_INVARIANT(!state.working);
    state.working = true;
    lock.unlock();
    work();
    work = nullptr;
    lock.lock();
    state.working = false;
  }
  state.hasThread = false;
}

namespace {

using TimePoint = std::chrono::steady_clock::time_point;

struct TimerRecord {
  std::shared_ptr<SerialQueue> queue;
  std::chrono::nanoseconds interval;
  Closure handler;
};

struct Firing {
  TimePoint due;
  std::shared_ptr<TimerRecord> timer;
  bool operator<(const Firing& other) const { return due > other.due; }
};

// The one thread that submits the handlers of all timers when they are due. It never runs a handler
// itself, so a slow one delays no other timer. It lives as long as the process.
class TimerThread {
 public:
  static TimerThread& shared() {
    static TimerThread& instance = *new TimerThread;
    return instance;
  }

  void add(std::shared_ptr<TimerRecord> timer) {
    const std::lock_guard lock(mutex_);
    firings_.push({std::chrono::steady_clock::now(), std::move(timer)});
    changed_.notify_one();
  }

 private:
  TimerThread() {
    std::thread([this] { run(); }).detach();
  }

  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      if (firings_.empty()) {
        changed_.wait(lock);
        continue;
      }
      Firing next = firings_.top();
      const TimePoint now = std::chrono::steady_clock::now();
      if (next.due > now) {
        changed_.wait_until(lock, next.due);
        continue;
      }
      firings_.pop();
      // After a long sleep of the machine the missed firings are not made up for.
      next.due = std::max(next.due + next.timer->interval, now);
      firings_.push(next);
      lock.unlock();
      next.timer->queue->async([timer = next.timer] { timer->handler(); });
      lock.lock();
    }
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::priority_queue<Firing> firings_;
};

class SharedThreadTimer final : public RepeatingTimer {
 public:
  explicit SharedThreadTimer(std::shared_ptr<TimerRecord> record) : record_(std::move(record)) {}
  void resume() override {
    if (record_) TimerThread::shared().add(std::exchange(record_, nullptr));
  }

 private:
  std::shared_ptr<TimerRecord> record_;
};

}  // namespace

std::shared_ptr<SerialQueue> WorkerQueueFactory::makeSerialQueue(std::string label) {
  return std::make_shared<WorkerQueue>(std::move(label));
}

std::shared_ptr<RepeatingTimer> WorkerQueueFactory::makeRepeatingTimer(
    std::shared_ptr<SerialQueue> queue, std::chrono::nanoseconds interval,
    std::chrono::nanoseconds /*leeway*/, Closure handler) {
  // The firings come on time, and any leeway allows that.
  return std::make_shared<SharedThreadTimer>(
      std::make_shared<TimerRecord>(TimerRecord{std::move(queue), interval, std::move(handler)}));
}

}  // namespace tessel
