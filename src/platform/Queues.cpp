// Queues and timers on threads.
//
// Threads exist only while there is work. A queue that gets work takes an idle thread of the pool,
// or a new one if none is idle; a thread that has emptied its queue serves the next, and ends if
// none comes within a moment. The service has half a dozen queues and sleeps for a day between two
// runs: a thread for each would cost a stack and a wakeup for nothing.
//
// The pool has a limit, because the polls of all past runs may come due at once. Without one, a
// process that had slept would start a thread for each of them, and the system refuses what is over
// the limits of the unit or the user. The price is that a closure of the pool must not wait for
// another queue. What may not wait at all (the interrupt, the sends of a run, the writer of the
// spool) has a queue with a thread of its own.
//
// The first thread of the pool and that of the timers never end. They are made when the process
// starts, so work that comes later never finds itself without a thread: if the system refuses a
// further one, the work waits for those that are there.
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
#include <atomic>
#include <condition_variable>
#include <deque>
#include <list>
#include <mutex>
#include <queue>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Invariant.h"

namespace tessel {

namespace {

// The unit allows the process 32 tasks. Sixteen may be children that read journal files of an
// unknown layout, and eight are threads that always exist or watch the configuration.
constexpr size_t kMostPoolThreads = 8;
// An idle thread waits this long for work. A run submits its closures within microseconds of each
// other, so one thread serves them all. An idle process has given its threads back after 20 ms.
constexpr std::chrono::milliseconds kIdleThreadLife{20};
// Between two attempts to start a thread. Threads of others end at any time, and ten attempts a
// second cost nothing.
constexpr std::chrono::milliseconds kThreadRetry{100};

// True on the threads of the pool.
thread_local bool onPoolThread = false;

// False if the system has no thread to give.
bool tryStartThread(const Closure& body) {
  try {
    std::thread(body).detach();
    return true;
  } catch (const std::system_error&) {
    return false;
  }
}

}  // namespace

void startThread(const Closure& body) {
  while (!tryStartThread(body)) std::this_thread::sleep_for(kThreadRetry);
}

bool startThread(const Closure& body, std::chrono::milliseconds patience) {
  for (auto waited = std::chrono::milliseconds{0}; !tryStartThread(body); waited += kThreadRetry) {
    if (waited >= patience) return false;
    std::this_thread::sleep_for(kThreadRetry);
  }
  return true;
}

struct WorkerQueue::State {
  State(std::string name, QueueThread thread)
      : label(std::move(name)),
        arrived(thread == QueueThread::own ? new std::condition_variable : nullptr) {}

  const std::string label;
  std::mutex mutex;
  std::list<Closure> work;  // a list, because an empty one has nothing on the heap
  // Wakes the queue's own thread. Absent on the queues that share the pool: a process that stays
  // keeps a queue of each past run, and this would be a tenth of its memory.
  const std::unique_ptr<std::condition_variable> arrived;
  bool hasThread = false;  // a thread of the pool works on it or will do so soon
  bool working = false;    // a closure is running
  bool dropped = false;    // nobody can submit any more
};

// The threads that queues share.
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
    } else if (threads_ < kMostPoolThreads) {
      // We hold the lock until the thread is detached. detach() reads memory that a thread gives
      // back when it ends, and this thread needs the lock before it can end. If there is no thread
      // to be had, the queue waits for those that exist.
      if (tryStartThread([this] { run(); })) ++threads_;
    }
  }

 private:
  Threads() {
    startThread([this] { run(); });
  }

  void run() {
    onPoolThread = true;
    std::unique_lock lock(mutex_);
    while (waitForQueue(lock)) {
      const std::shared_ptr<State> queue = std::move(waiting_.front());
      waiting_.pop_front();
      lock.unlock();
      drain(*queue);
      lock.lock();
    }
    --threads_;
  }

  // False if this thread should end. The last one stays, because work that comes then must not
  // depend on whether the system has a thread to give.
  bool waitForQueue(std::unique_lock<std::mutex>& lock) {
    ++idle_;
    bool timedOut = false;
    while (waiting_.empty() && !(timedOut && threads_ > 1)) {
      if (threads_ == 1) {
        arrived_.wait(lock);
      } else {
        timedOut = arrived_.wait_for(lock, kIdleThreadLife) == std::cv_status::timeout;
      }
    }
    --idle_;
    return !waiting_.empty();
  }

  // `hasThread` lets only one thread into a queue, which makes it serial.
  static void drain(State& queue) {
    std::unique_lock lock(queue.mutex);
    runAll(queue, lock);
    queue.hasThread = false;
  }

  std::mutex mutex_;
  std::condition_variable arrived_;
  std::deque<std::shared_ptr<State>> waiting_;
  size_t idle_ = 0;
  size_t threads_ = 1;
};

WorkerQueue::WorkerQueue(std::string label, QueueThread thread)
    : state_(std::make_shared<State>(std::move(label), thread)) {
  if (thread == QueueThread::own) startThread([state = state_] { serve(*state); });
}

WorkerQueue::~WorkerQueue() {
  if (!state_->arrived) return;
  const std::lock_guard lock(state_->mutex);
  state_->dropped = true;
  state_->arrived->notify_one();
}

void WorkerQueue::startPool() { Threads::shared(); }

const std::string& WorkerQueue::label() const { return state_->label; }

void WorkerQueue::async(Closure work) {
  {
    const std::lock_guard lock(state_->mutex);
    state_->work.push_back(std::move(work));
    if (state_->arrived) return state_->arrived->notify_one();
    if (std::exchange(state_->hasThread, true)) return;
  }
  Threads::shared().take(state_);
}

void WorkerQueue::sync(const Closure& work) {
  // If closures of the pool waited for other queues, they could hold all threads of the pool, and
  // what they wait for would never run.
  TESSEL_INVARIANT(!onPoolThread);
  Semaphore done(0);
  async([&work, &done] {
    work();
    done.signal();
  });
  while (!done.waitFor(std::chrono::hours(1))) {
  }
}

// The life of a queue's own thread. It ends with the last closure of a queue that was dropped.
void WorkerQueue::serve(State& state) {
  std::unique_lock lock(state.mutex);
  for (;;) {
    runAll(state, lock);
    if (state.dropped) return;
    state.arrived->wait(lock);
  }
}

// Runs everything that the queue holds. async() promises that each closure is destroyed right after
// it ran, so this does it before the next one begins. REQUIRES: `lock` holds the queue's mutex.
void WorkerQueue::runAll(State& state, std::unique_lock<std::mutex>& lock) {
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
}

namespace {

using TimePoint = std::chrono::steady_clock::time_point;

struct TimerRecord {
  std::shared_ptr<SerialQueue> queue;
  std::chrono::nanoseconds interval;
  Closure handler;
  std::atomic<bool> queued{false};  // a firing waits on the queue
};

// `timer` lives as long as the process, as the timer does.
struct Firing {
  TimePoint due;
  TimerRecord* timer;
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

  void add(std::unique_ptr<TimerRecord> timer) {
    const std::lock_guard lock(mutex_);
    firings_.push({std::chrono::steady_clock::now(), timer.release()});
    changed_.notify_one();
  }

 private:
  TimerThread() {
    startThread([this] { run(); });
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
      submit(*next.timer);
      lock.lock();
    }
  }

  // Without the flag, a queue that is stuck (a disk that never answers) would collect firings for
  // as long as it is stuck.
  static void submit(TimerRecord& timer) {
    if (timer.queued.exchange(true)) return;
    timer.queue->async([&timer] {
      timer.queued = false;
      timer.handler();
    });
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::priority_queue<Firing> firings_;
};

class SharedThreadTimer final : public RepeatingTimer {
 public:
  explicit SharedThreadTimer(std::unique_ptr<TimerRecord> record) : record_(std::move(record)) {}
  void resume() override {
    if (record_) TimerThread::shared().add(std::move(record_));
  }

 private:
  std::unique_ptr<TimerRecord> record_;
};

}  // namespace

WorkerQueueFactory::WorkerQueueFactory() {
  WorkerQueue::startPool();
  TimerThread::shared();
}

std::shared_ptr<SerialQueue> WorkerQueueFactory::makeSerialQueue(std::string label) {
  return std::make_shared<WorkerQueue>(std::move(label));
}

std::shared_ptr<RepeatingTimer> WorkerQueueFactory::makeRepeatingTimer(
    std::shared_ptr<SerialQueue> queue, std::chrono::nanoseconds interval,
    std::chrono::nanoseconds /*leeway*/, Closure handler) {
  // The leeway lets a firing be late. Ours come on time, so it is not needed.
  return std::make_shared<SharedThreadTimer>(std::unique_ptr<TimerRecord>(
      new TimerRecord{std::move(queue), interval, std::move(handler)}));
}

}  // namespace tessel
