// The background-activity scheduler as the service uses it.

#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace tessel {

// Activity states, as the scheduler numbers them.
inline constexpr int64_t kActivityStateCheckIn = 0;
inline constexpr int64_t kActivityStateRun = 2;
inline constexpr int64_t kActivityStateDefer = 3;

// One registered activity. Any thread may ask.
class Activity {
 public:
  virtual ~Activity() = default;
  virtual int64_t state() = 0;
  // Whether the scheduler wants the activity to give its slot back.
  virtual bool shouldDefer() = 0;
  // False where the scheduler did not take the state.
  virtual bool setState(int64_t state) = 0;
};

using ActivityHandler = std::function<void(const std::shared_ptr<Activity>&)>;

class ActivityScheduler {
 public:
  virtual ~ActivityScheduler() = default;
  // Registers for check-in; the criteria are those of the launch configuration. The handler is
  // called on a thread of the scheduler's own, never twice at a time.
  virtual void registerActivity(const std::string& name, ActivityHandler handler) = 0;
};

}  // namespace tessel
