// Queues and timers on threads of their own.

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

namespace tessel {

namespace {
// Long enough for the next of a row of closures, short enough that idle threads do not add up.
constexpr std::chrono::milliseconds kIdleThreadLife{20};
}  // namespace

struct WorkerQueue::State {
  explicit State(std::string name) : label(std::move(name)) {}

  const std::string label;
  std::mutex mutex;
  std::list<Closure> work;  // a list takes nothing from the heap while it is empty
  bool hasThread = false;   // or is about to have one
};

// The threads of all queues. A queue that gets work waits for one that is idle, or gets a new one.
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
    // Under the lock, without which the thread cannot end: detach() of the C library still reads
    // what a thread that ends meanwhile gives back to the system.
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

void WorkerQueue::drain(State& state) {
  std::unique_lock lock(state.mutex);
  while (!state.work.empty()) {
    Closure work = std::move(state.work.front());
    state.work.pop_front();
    lock.unlock();
    work();
    work = nullptr;
    lock.lock();
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

// The one thread that submits timer handlers when they are due. Lives as long as the process.
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
      // A firing that could not be kept is not made up for.
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
  // Firings come on time, which every leeway allows.
  return std::make_shared<SharedThreadTimer>(
      std::make_shared<TimerRecord>(TimerRecord{std::move(queue), interval, std::move(handler)}));
}

}  // namespace tessel
