// The role by which everything gets its threads and waits: Threads. Its implementation on the
// threads of the standard library, and the semaphore on which everything waits.
//
// Nothing else in the service makes a thread or blocks one, apart from a lock that is held for a
// few instructions, a system call, and the two that wait for the kernel (a signal, a file that
// changes). So whoever implements this role decides which thread goes on when. A test that runs
// one thread at a time, in an order drawn from a number, replays every run from that number. The
// price: a thread waits for one semaphore and for nothing else.

#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <mutex>
#include <system_error>
#include <thread>

namespace tessel {

using Closure = std::function<void()>;

// A counting semaphore. Any thread may use it. Threads::wait() waits on it.
class Semaphore {
 public:
  explicit Semaphore(uint64_t count) : count_(count) {}

  void signal() {
    // Notify under the lock: as soon as the waiter gets the lock, it may destroy the semaphore.
    const std::lock_guard lock(mutex_);
    ++count_;
    condition_.notify_one();
  }
  // Takes one unit. False if there is none now.
  bool tryTake() {
    const std::lock_guard lock(mutex_);
    if (count_ == 0) return false;
    --count_;
    return true;
  }
  // Whether there is a unit now. Another thread may take it at any moment.
  bool hasUnit() {
    const std::lock_guard lock(mutex_);
    return count_ > 0;
  }
  // Blocks this thread until it has taken a unit. False if none came within `timeout`, measured
  // from the call. Only an implementation of Threads and tests call it.
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

// Makes threads and lets them wait. Lives as long as the process. Any thread.
class Threads {
 public:
  // Longer than any process lives, and short enough to be added to the time of any clock.
  static constexpr std::chrono::nanoseconds kForEver = std::chrono::hours{24 * 365 * 100};

  virtual ~Threads() = default;
  // Runs `body` on a new thread that nobody joins. False if the system has no thread to give. Does
  // not wait, so the caller may hold a lock.
  virtual bool start(const Closure& body) = 0;
  // Takes one unit of the semaphore. False if none came within `timeout`. REQUIRES: the caller
  // holds no lock. The same goes for sleep().
  virtual bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) = 0;
  virtual void sleep(std::chrono::nanoseconds time) {
    Semaphore never(0);
    wait(never, time);
  }
  // The time by which waits are measured, from a beginning that means nothing. Nobody can set it.
  virtual std::chrono::nanoseconds time() = 0;
};

// The threads of the standard library. Stateless.
class StandardThreads final : public Threads {
 public:
  bool start(const Closure& body) override {
    try {
      std::thread(body).detach();
      return true;
    } catch (const std::system_error&) {
      return false;
    }
  }
  bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) override {
    return semaphore.waitFor(timeout);
  }
  std::chrono::nanoseconds time() override {
    return std::chrono::steady_clock::now().time_since_epoch();
  }
};

// Runs `body` on a new thread that nobody joins. A system that has no thread to give may have one a
// moment later, so the call then waits and tries again.
void startThread(Threads& threads, const Closure& body);
// The same, but false if the system had no thread to give for as long as `patience`.
bool startThread(Threads& threads, const Closure& body, std::chrono::milliseconds patience);

}  // namespace tessel
