// Semaphore: a counting semaphore whose wait can time out.

#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>

namespace tessel {

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

}  // namespace tessel
