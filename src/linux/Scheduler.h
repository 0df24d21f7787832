// The background-activity scheduler decides when a run is due, defers it at a bad time, and
// delivers it.

#pragma once

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "linux/LaunchConfiguration.h"
#include "linux/ServiceRuntime.h"
#include "linux/StateDirectory.h"
#include "platform/System.h"

namespace tessel {

// Why a run must wait, or end before it has read everything.
enum class DeferReason : uint8_t {
  none,
  file,      // the file <state>/defer
  battery,   // the machine runs on a low battery
  pressure,  // tasks wait for the CPU
  runLimit,  // the run has taken too long
};

// Battery and pressure are the machine's own state. They pass without anybody's help, or never.
constexpr bool isOfTheMachine(DeferReason reason) {
  return reason == DeferReason::battery || reason == DeferReason::pressure;
}

// Says whether now is a bad time for a run. It reads files at the moment it is asked. A service
// that waits for ever would be worse than one that runs at a bad time. So a file that is missing or
// cannot be understood never defers. Immutable; any thread may ask.
class DeferralConditions {
 public:
  // `deferFile` defers a run while it exists. The other two paths are the kernel's, except in
  // tests.
  DeferralConditions(DeferSources sources, std::string deferFile,
                     std::string powerSupplyDirectory = "/sys/class/power_supply",
                     std::string pressureFile = "/proc/pressure/cpu");

  // Whether the defer file wants a run to wait or to stop.
  DeferReason byFile() const;
  // Whether the state of the machine wants a run to wait.
  DeferReason byMachine() const;
  // The reason for people. It goes after a colon.
  std::string words(DeferReason reason) const;

 private:
  bool deferFileExists() const;
  bool batteryIsLow() const;
  bool cpuIsUnderPressure() const;

  const DeferSources sources_;
  const std::string deferFile_;
  const std::string powerSupplyDirectory_;
  const std::string pressureFile_;
};

// How long to wait until the next run. It is due `interval` after the begin of the last run; the
// answer is zero from then on. `waited` is how long this wait has lasted already, by a clock that
// nobody can set. It keeps the whole wait below the interval even if the wall clock is set back.
inline std::chrono::nanoseconds waitForRun(std::optional<Date> lastRun, Date now,
                                           std::chrono::seconds interval,
                                           std::chrono::nanoseconds waited) {
  using std::chrono::nanoseconds;
  const auto sinceLastRun = lastRun ? now - *lastRun : Date::duration::max();
  if (sinceLastRun >= interval) return nanoseconds{0};
  // A last run in the future says nothing, so the whole interval is waited for.
  const nanoseconds byWallClock = interval - std::max(sinceLastRun, Date::duration::zero());
  return std::clamp(interval - waited, nanoseconds{0}, byWallClock);
}

struct ScheduleCriteria {
  std::optional<std::chrono::seconds> interval;  // absent: one run, then nothing is pending
  std::chrono::seconds deferRetry{900};
  std::chrono::seconds runLimit{21'600};  // zero: no limit
  std::chrono::seconds deferLimit{7200};  // of what the machine may put one run off, in all
};

// Delivers the check-in and then runs to the one activity of the process.
//
// Without an interval one run follows the check-in at once. With an interval a run is delivered
// whenever that much time has passed since the last run began. While its run is being delivered, an
// activity may set its state to "defer", once; it takes no other state. A deferred run is delivered
// again after the retry time.
//
// An activity asks whether to defer once before its run begins, and after that while the run is
// under way. What the answer goes by:
//
//                        before the run                      under way
//   the defer file       as long as it stands                as long as it stands
//   battery, pressure    until they have put the run off     never: whoever keeps the machine busy
//                        for `deferLimit` in all             must not be able to stop every run
//   the run limit        -                                   once the run has taken that long
//
// Each reason for which a run waits or stops is one warning in the log.
//
// Threads: registerActivity() makes one thread, which calls the handler and lives as long as
// something is pending. The scheduler and everything given to its constructor live as long as the
// process.
class BackgroundScheduler final : public ActivityScheduler {
 public:
  BackgroundScheduler(ScheduleCriteria criteria, const StateDirectory& state,
                      const DeferralConditions& conditions, ServiceRuntime& runtime,
                      ServiceStatus& status, Clock& clock, Threads& threads);

  // REQUIRES: called once.
  void registerActivity(const std::string& name, ActivityHandler handler) override;

 private:
  const ScheduleCriteria criteria_;
  const StateDirectory& state_;
  const DeferralConditions& conditions_;
  ServiceRuntime& runtime_;
  ServiceStatus& status_;
  Clock& clock_;
  Threads& threads_;
};

// What the scheduler's thread does, step by step. Threads: one at a time.
class ActivityDeliveries {
 public:
  ActivityDeliveries(ScheduleCriteria criteria, const StateDirectory& state,
                     const DeferralConditions& conditions, ServiceStatus& status, Clock& clock,
                     Threads& threads, ActivityHandler handler);

  void deliverCheckIn();
  // Waits until a run is due and no other process runs, and delivers it. False if no further
  // delivery is pending.
  bool deliverRun();

 private:
  RunLock waitForTurn();
  std::optional<RunLock> waitForLock();
  std::optional<Date> waitUntilDue();
  std::optional<Date> lastRun() const;
  void record(Date begin);
  std::chrono::nanoseconds planWait(DeferReason reason) const;
  void putOff(DeferReason reason, std::chrono::nanoseconds wait);
  void recordPutOff(std::chrono::nanoseconds time) const;
  bool machineMayDefer() const { return putOffByMachine_ < criteria_.deferLimit; }
  void warnOnce(DeferReason reason);
  void waitFor(std::chrono::nanoseconds duration);

  const ScheduleCriteria criteria_;
  const StateDirectory& state_;
  const DeferralConditions& conditions_;
  ServiceStatus& status_;
  Clock& clock_;
  Threads& threads_;
  const ActivityHandler handler_;
  std::optional<Date> lastRunHere_;  // the last run of this process; recording it may have failed
  // How long battery and pressure have put off the run that is due. It includes what earlier
  // processes recorded.
  std::chrono::nanoseconds putOffByMachine_;
  std::vector<DeferReason> warnedOf_;  // for the run that is due
};

}  // namespace tessel
