// The background-activity scheduler: when a run is due, when it is deferred, and its delivery.

#pragma once

#include <algorithm>
#include <chrono>
#include <memory>
#include <optional>
#include <string>

#include "linux/LaunchConfiguration.h"
#include "linux/ServiceRuntime.h"
#include "linux/StateDirectory.h"
#include "platform/System.h"

namespace tessel {

// DeferralConditions: whether now is a bad time for a run.
//
// Each question is answered from files at the moment it is asked. A file that is missing, cannot be
// read or makes no sense never defers. Immutable; any thread may ask.

class DeferralConditions {
 public:
  // `deferFile` defers by being there. The other two are the kernel's, elsewhere in tests.
  DeferralConditions(DeferSources sources, std::string deferFile,
                     std::string powerSupplyDirectory = "/sys/class/power_supply",
                     std::string pressureFile = "/proc/pressure/cpu");

  // Why a run should wait, in words; nothing where it need not.
  std::optional<std::string> reason() const;

 private:
  bool deferFileExists() const;
  bool batteryIsLow() const;
  bool cpuIsUnderPressure() const;

  const DeferSources sources_;
  const std::string deferFile_;
  const std::string powerSupplyDirectory_;
  const std::string pressureFile_;
};

// When the next run is due, as plain arithmetic.

// How long to wait for the run that comes `interval` after the one that began at `lastRun`; zero
// where it is due. `waited` is how long this wait has lasted, by a clock that nobody sets: however
// the wall clock is set meanwhile, or stands before the last run, no wait exceeds the interval.
inline std::chrono::nanoseconds waitForRun(std::optional<Date> lastRun, Date now,
                                           std::chrono::seconds interval,
                                           std::chrono::nanoseconds waited) {
  using std::chrono::nanoseconds;
  const auto sinceLastRun = lastRun ? now - *lastRun : Date::duration::max();
  if (sinceLastRun >= interval) return nanoseconds{0};
  // A run in the future tells nothing: the whole interval is waited for.
  const nanoseconds byWallClock = interval - std::max(sinceLastRun, Date::duration::zero());
  return std::clamp(interval - waited, nanoseconds{0}, byWallClock);
}

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
