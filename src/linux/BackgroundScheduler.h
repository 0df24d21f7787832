// BackgroundScheduler: delivers check-in and runs to the one activity of the process.
//
// The check-in comes first. Without an interval one run follows at once, and when it is over
// nothing is pending any more. With an interval a run follows whenever that much time has passed
// since the last one began, by the record in the state directory, so there is always one pending.
// A run is delivered under the state directory's lock; a process that has to wait for the lock gets
// its run afterwards, if it is still due. A deferred run is not recorded and is offered again after
// the retry time.
//
// An activity takes one state: 3 (defer), once, while its run is being delivered.
//
// The handler is called on one thread, made by registerActivity(), which lives as long as there is
// something pending. Everything given to the constructor must outlive the scheduler, and the
// scheduler its thread: all live as long as the process.

#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>

#include "linux/DeferralConditions.h"
#include "linux/ServiceRuntime.h"
#include "linux/StateDirectory.h"
#include "platform/Activity.h"
#include "platform/Clock.h"
#include "platform/ServiceStatus.h"

namespace tessel {

struct ScheduleCriteria {
  std::optional<std::chrono::seconds> interval;
  std::chrono::seconds deferRetry{900};
};

class BackgroundScheduler final : public ActivityScheduler {
 public:
  BackgroundScheduler(ScheduleCriteria criteria, const StateDirectory& state,
                      const DeferralConditions& conditions, ServiceRuntime& runtime,
                      ServiceStatus& status, Clock& clock);

  // REQUIRES: called once.
  void registerActivity(const std::string& name, ActivityHandler handler) override;

 private:
  const ScheduleCriteria criteria_;
  const StateDirectory& state_;
  const DeferralConditions& conditions_;
  ServiceRuntime& runtime_;
  ServiceStatus& status_;
  Clock& clock_;
};

// What the scheduler's thread does, step by step; one thread at a time.
class ActivityDeliveries {
 public:
  ActivityDeliveries(ScheduleCriteria criteria, const StateDirectory& state,
                     const DeferralConditions& conditions, ServiceStatus& status, Clock& clock,
                     ActivityHandler handler);

  void deliverCheckIn();
  // Waits until a run is due and nobody else runs, and delivers it. False when no further delivery
  // is pending.
  bool deliverRun();

 private:
  RunLock waitForTurn();
  std::optional<RunLock> waitForLock();
  std::optional<Date> waitUntilDue();
  std::optional<Date> lastRun() const;
  void record(Date begin);
  void waitForRetry();
  void wait(std::chrono::nanoseconds duration);
  std::chrono::nanoseconds since(uint64_t ticks);

  const ScheduleCriteria criteria_;
  const StateDirectory& state_;
  const DeferralConditions& conditions_;
  ServiceStatus& status_;
  Clock& clock_;
  const ActivityHandler handler_;
  std::optional<Date> lastRunHere_;
};

}  // namespace tessel
