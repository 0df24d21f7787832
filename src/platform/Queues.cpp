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
// static storage while those threads go on. Whatever they touch (the pool, TimerThread, the sink of
// the log) is made by `new` and never deleted, and a thread shares the state of the queue that it
// works on. An unfinished closure ends with the process. That does no harm: the spool keeps every
// row that it has taken, and a run leaves its marker.

#include "platform/Queues.h"

#include <algorithm>
#include <atomic>
#include <deque>
#include <list>
#include <queue>
#include <utility>

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

}  // namespace

void startThread(Threads& threads, const Closure& body) {
  while (!threads.start(body)) threads.sleep(kThreadRetry);
}

bool startThread(Threads& threads, const Closure& body, std::chrono::milliseconds patience) {
  for (auto waited = std::chrono::milliseconds{0}; !threads.start(body); waited += kThreadRetry) {
    if (waited >= patience) return false;
    threads.sleep(kThreadRetry);
  }
  return true;
}

// What a thread needs of the queue that it works on. They share it.
struct WorkerQueue::State {
  State(std::string name, Threads& threadsIn, ThreadPool::Members* poolIn)
      : label(std::move(name)),
        threads(threadsIn),
        pool(poolIn),
        arrived(pool == nullptr ? new Semaphore(0) : nullptr) {}

  const std::string label;
  std::mutex mutex;
  std::list<Closure> work;  // a list, because an empty one has nothing on the heap
  Threads& threads;
  ThreadPool::Members* const pool;  // absent if the queue has a thread of its own
  // Wakes the queue's own thread. Absent on the queues that share a pool: a process that stays
  // keeps a queue of each past run, and this would be a tenth of its memory.
  const std::unique_ptr<Semaphore> arrived;
  bool hasThread = false;  // a thread works on it or will do so soon
  bool working = false;    // a closure is running
  bool dropped = false;    // nobody can submit any more
};

// The threads that queues share.
class ThreadPool::Members {
 public:
  explicit Members(Threads& threads) : system_(threads) {
    startThread(system_, [this] { run(); });
  }

  Threads& system() { return system_; }

  void take(std::shared_ptr<WorkerQueue::State> queue) {
    const std::lock_guard lock(mutex_);
    waiting_.push_back(std::move(queue));
    if (idle_ >= waiting_.size()) {
      arrived_.signal();
    } else if (threads_ < kMostPoolThreads) {
      // We hold the lock until the thread is detached. detach() reads memory that a thread gives
      // back when it ends, and this thread needs the lock before it can end. If there is no thread
      // to be had, the queue waits for those that exist.
      if (system_.start([this] { run(); })) ++threads_;
    }
  }

 private:
  void run() {
    ownsThisThread() = true;
    std::unique_lock lock(mutex_);
    while (waitForQueue(lock)) {
      const std::shared_ptr<WorkerQueue::State> queue = std::move(waiting_.front());
      waiting_.pop_front();
      lock.unlock();
      WorkerQueue::drain(*queue);
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
      const bool last = threads_ == 1;
      lock.unlock();
      timedOut = !system_.wait(arrived_, last ? Threads::kForEver : kIdleThreadLife);
      lock.lock();
    }
    --idle_;
    return !waiting_.empty();
  }

  Threads& system_;
  std::mutex mutex_;
  // May have a unit for a queue that is taken already. Its taker then finds nothing and waits on.
  Semaphore arrived_{0};
  std::deque<std::shared_ptr<WorkerQueue::State>> waiting_;
  size_t idle_ = 0;
  size_t threads_ = 1;
};

// Never deleted: its threads use it.
ThreadPool::ThreadPool(Threads& threads) : members_(*new Members(threads)) {}

bool& ThreadPool::ownsThisThread() {
  thread_local bool owns = false;
  return owns;
}

WorkerQueue::WorkerQueue(std::string label, ThreadPool& pool)
    : state_(std::make_shared<State>(std::move(label), pool.members_.system(), &pool.members_)) {}

WorkerQueue::WorkerQueue(std::string label, Threads& threads)
    : state_(std::make_shared<State>(std::move(label), threads, nullptr)) {
  state_->hasThread = true;
  startThread(threads, [state = state_] { serve(*state); });
}

WorkerQueue::~WorkerQueue() {
  if (!state_->arrived) return;
  const std::lock_guard lock(state_->mutex);
  state_->dropped = true;
  state_->arrived->signal();
}

const std::string& WorkerQueue::label() const { return state_->label; }

void WorkerQueue::async(Closure work) {
  {
    const std::lock_guard lock(state_->mutex);
    state_->work.push_back(std::move(work));
    if (std::exchange(state_->hasThread, true)) return;
    if (state_->arrived) return state_->arrived->signal();
  }
  state_->pool->take(state_);
}

void WorkerQueue::sync(const Closure& work) {
  // If closures of the pool waited for other queues, they could hold all threads of the pool, and
  // what they wait for would never run.
  TESSEL_INVARIANT(!ThreadPool::ownsThisThread());
  Semaphore done(0);
  async([&work, &done] {
    work();
    done.signal();
  });
  while (!state_->threads.wait(done, Threads::kForEver)) {
  }
}

// The life of a queue's own thread. It ends with the last closure of a queue that was dropped.
void WorkerQueue::serve(State& state) {
  std::unique_lock lock(state.mutex);
  for (;;) {
    runAll(state, lock);
    if (state.dropped) return;
    lock.unlock();
    state.threads.wait(*state.arrived, Threads::kForEver);
    lock.lock();
  }
}

// The work of a thread of the pool.
void WorkerQueue::drain(State& state) {
  std::unique_lock lock(state.mutex);
  runAll(state, lock);
}

// Runs everything that the queue holds. async() promises that each closure is destroyed right after
// it ran, so this does it before the next one begins. `hasThread` lets only one thread in, which
// makes the queue serial. REQUIRES: `lock` holds the queue's mutex.
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
  state.hasThread = false;
}

namespace {

struct TimerRecord {
  std::shared_ptr<SerialQueue> queue;
  std::chrono::nanoseconds interval;
  Closure handler;
  std::atomic<bool> queued{false};  // a firing waits on the queue
};

// `timer` lives as long as the process, as the timer does.
struct Firing {
  std::chrono::nanoseconds due;  // by Threads::time()
  TimerRecord* timer;
  bool operator<(const Firing& other) const { return due > other.due; }
};

}  // namespace

// The one thread that submits the handlers of all timers when they are due. It never runs a handler
// itself, so a slow handler delays no other timer. It lives as long as the process.
class WorkerQueueFactory::TimerThread {
 public:
  explicit TimerThread(Threads& threads) : threads_(threads) {
    startThread(threads_, [this] { run(); });
  }

  void add(std::unique_ptr<TimerRecord> timer) {
    const std::lock_guard lock(mutex_);
    firings_.push({threads_.time(), timer.release()});
    changed_.signal();
  }

 private:
  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      const std::chrono::nanoseconds now = threads_.time();
      const auto due = firings_.empty() ? now + Threads::kForEver : firings_.top().due;
      if (due > now) {
        lock.unlock();
        threads_.wait(changed_, due - now);
        lock.lock();
        continue;
      }
      Firing next = firings_.top();
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

  Threads& threads_;
  std::mutex mutex_;
  Semaphore changed_{0};
  std::priority_queue<Firing> firings_;
};

class WorkerQueueFactory::SharedThreadTimer final : public RepeatingTimer {
 public:
  SharedThreadTimer(TimerThread& timers, std::unique_ptr<TimerRecord> record)
      : timers_(timers), record_(std::move(record)) {}
  void resume() override {
    if (record_) timers_.add(std::move(record_));
  }

 private:
  TimerThread& timers_;
  std::unique_ptr<TimerRecord> record_;
};

// The thread of the timers is never deleted: it uses itself.
WorkerQueueFactory::WorkerQueueFactory(Threads& threads)
    : pool_(threads), timers_(*new TimerThread(threads)) {}

std::shared_ptr<SerialQueue> WorkerQueueFactory::makeSerialQueue(std::string label) {
  return std::make_shared<WorkerQueue>(std::move(label), pool_);
}

std::shared_ptr<RepeatingTimer> WorkerQueueFactory::makeRepeatingTimer(
    std::shared_ptr<SerialQueue> queue, std::chrono::nanoseconds interval,
    std::chrono::nanoseconds /*leeway*/, Closure handler) {
  // The leeway lets a firing be late. Ours come on time, so it is not needed.
  return std::make_shared<SharedThreadTimer>(
      timers_, std::unique_ptr<TimerRecord>(
                   new TimerRecord{std::move(queue), interval, std::move(handler)}));
}

}  // namespace tessel
