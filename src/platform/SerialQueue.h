// SerialQueue and RepeatingTimer: work that runs one piece at a time, in order of submission.

#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

namespace tessel {

using Closure = std::function<void()>;

// A first-in first-out queue. What is submitted from any thread runs one closure at a time, each
// after all that was submitted before it. A queue that is dropped still runs what it holds.
class SerialQueue {
 public:
  virtual ~SerialQueue() = default;
  virtual const std::string& label() const = 0;
  // Returns at once; `work` runs later and is destroyed right after it ran.
  virtual void async(Closure work) = 0;
  // Returns when `work` has run. REQUIRES: not called from the queue itself.
  virtual void sync(const Closure& work) = 0;
};

// A timer that submits its handler to a queue: once when resumed and then every interval. A firing
// may come up to the leeway late. It goes on for as long as the process lives, also after the last
// reference to it was dropped.
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

}  // namespace tessel
