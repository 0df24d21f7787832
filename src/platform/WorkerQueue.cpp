// Queues and timers on threads of their own.

#include "platform/WorkerQueue.h"

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <queue>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Semaphore.h"

namespace tessel {

namespace {
// Long enough for the next of a row of closures, short enough that the polls of a thousand past runs,
// each on a queue of its own, do not add up to a crowd of idle threads.
constexpr std::chrono::milliseconds kIdleThreadLife{20};
}

struct WorkerQueue::State {
  explicit State(std::string name) : label(std::move(name)) {}

  const std::string label;
  std::mutex mutex;
  std::condition_variable arrived;
  std::deque<Closure> work;
  bool hasThread = false;
};

WorkerQueue::WorkerQueue(std::string label) : state_(std::make_shared<State>(std::move(label))) {}

const std::string& WorkerQueue::label() const { return state_->label; }

void WorkerQueue::async(Closure work) {
  const std::lock_guard lock(state_->mutex);
  state_->work.push_back(std::move(work));
  if (std::exchange(state_->hasThread, true)) {
    state_->arrived.notify_one();
    return;
  }
  // Under the lock, without which the thread cannot end: detach() of the C library still reads what
  // a thread that ends meanwhile gives back to the system.
  std::thread([state = state_] { drain(state); }).detach();
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

void WorkerQueue::drain(const std::shared_ptr<State>& state) {
  std::unique_lock lock(state->mutex);
  for (;;) {
    if (!state->arrived.wait_for(lock, kIdleThreadLife, [&] { return !state->work.empty(); })) {
      state->hasThread = false;
      return;
    }
    Closure work = std::move(state->work.front());
    state->work.pop_front();
    lock.unlock();
    work();
    work = nullptr;
    lock.lock();
  }
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
