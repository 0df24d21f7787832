// Queues and timers on threads.
//
// Threads exist only while there is work. A queue that gets work takes an idle thread, or a new one
// if none is idle; a thread that has emptied its queue serves the next, and ends if none comes
// within a moment. The service has half a dozen queues and sleeps for a day between two runs: a
// thread for each would cost a stack and a wakeup for nothing. A pool of fixed size was discarded,
// because a queue may wait for another (sync), and a full pool would then wait for ever.
//
// Every thread is detached. To join the threads at its end, the process would have to wait for
// closures that sleep (the throttle) or that wait for an event which never comes.
//
// So exit(0) may meet threads that are still running. The C library then destroys the objects with
// static storage while those threads go on. Whatever they touch (Threads, TimerThread, the sink of
// the log) is made by `new` and never deleted, and a thread shares the state of the queue that it
// works on. An unfinished closure ends with the process. That does no harm: the spool keeps every
// row that it has taken, and a run leaves its marker.

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
// other, so one thread serves them all. An idle process has no thread left after 20 ms.
constexpr std::chrono::milliseconds kIdleThreadLife{20};
}  // namespace

struct WorkerQueue::State {
  explicit State(std::string name) : label(std::move(name)) {}

  const std::string label;
  std::mutex mutex;
  std::list<Closure> work;  // a list, because an empty one has nothing on the heap
  bool hasThread = false;   // a thread works on it or will do so soon
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
    // We hold the lock until the thread is detached. detach() reads memory that a thread gives back
    // when it ends, and this thread needs the lock before it can end.
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

// Runs everything that the queue holds. `hasThread` lets only one thread in, which makes the queue
// serial. async() promises that each closure is destroyed right after it ran, so this does it
// before the next one begins.
void WorkerQueue::drain(State& state) {
  std::unique_lock lock(state.mutex);
  while (!state.work.empty()) {
    Closure work = std::move(state.work.front());
    state.work.pop_front();
    // The service has no locks of its own: it relies on closures that run one at a time.
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
// itself, so a slow handler delays no other timer. It lives as long as the process.
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
      // A process that was stopped for a while must not fire once for each interval that it missed.
      // It fires at most once more at once, and then goes on from now.
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
  // The leeway lets a firing be late. Ours come on time, so it is not needed.
  return std::make_shared<SharedThreadTimer>(
      std::make_shared<TimerRecord>(TimerRecord{std::move(queue), interval, std::move(handler)}));
}

}  // namespace tessel
