// Deliveries to the activity.

#include "linux/BackgroundScheduler.h"

#include <algorithm>
#include <mutex>
#include <thread>
#include <utility>

#include "linux/RunSchedule.h"
#include "platform/Log.h"

namespace tessel {

namespace {

// Longest single wait: the wall clock and the time spent asleep are looked at this often.
constexpr std::chrono::nanoseconds kLongestWait = std::chrono::minutes{1};

// One delivery to the activity. The state may change to "defer" while a run is being delivered.
class Delivery final : public Activity {
 public:
  Delivery(int64_t state, const DeferralConditions& conditions)
      : conditions_(conditions), state_(state) {}

  int64_t state() override {
    const std::lock_guard lock(mutex_);
    return state_;
  }
  bool shouldDefer() override { return conditions_.reason().has_value(); }
  bool setState(int64_t wanted) override {
    const std::lock_guard lock(mutex_);
    if (over_ || state_ != kActivityStateRun || wanted != kActivityStateDefer) return false;
    state_ = wanted;
    return true;
  }
  // Takes no state from here on. True where the run was deferred.
  bool end() {
    const std::lock_guard lock(mutex_);
    over_ = true;
    return state_ == kActivityStateDefer;
  }

 private:
  const DeferralConditions& conditions_;
  std::mutex mutex_;
  int64_t state_;
  bool over_ = false;
};

}  // namespace

BackgroundScheduler::BackgroundScheduler(ScheduleCriteria criteria, const StateDirectory& state,
                                         const DeferralConditions& conditions,
                                         ServiceRuntime& runtime, ServiceStatus& status,
                                         Clock& clock)
    : criteria_(criteria),
      state_(state),
      conditions_(conditions),
      runtime_(runtime),
      status_(status),
      clock_(clock) {}

void BackgroundScheduler::registerActivity(const std::string& /*name*/, ActivityHandler handler) {
  std::thread([pending = runtime_.expectDelivery(),
               deliveries = ActivityDeliveries(criteria_, state_, conditions_, status_, clock_,
                                               std::move(handler))]() mutable {
    deliveries.deliverCheckIn();
    while (deliveries.deliverRun()) {
    }
  }).detach();
}

ActivityDeliveries::ActivityDeliveries(ScheduleCriteria criteria, const StateDirectory& state,
                                       const DeferralConditions& conditions, ServiceStatus& status,
                                       Clock& clock, ActivityHandler handler)
    : criteria_(criteria),
      state_(state),
      conditions_(conditions),
      status_(status),
      clock_(clock),
      handler_(std::move(handler)) {}

void ActivityDeliveries::deliverCheckIn() {
  const auto delivery = std::make_shared<Delivery>(kActivityStateCheckIn, conditions_);
  handler_(delivery);
  delivery->end();
}

bool ActivityDeliveries::deliverRun() {
  std::optional<RunLock> turn = waitForTurn();
  const Date begin = clock_.now();
  const auto delivery = std::make_shared<Delivery>(kActivityStateRun, conditions_);
  handler_(delivery);
  if (delivery->end()) {
    turn.reset();
    status_.say("run deferred: " + conditions_.reason().value_or("no reason any more"));
    waitForRetry();
    return true;
  }
  record(begin);
  return criteria_.interval.has_value();
}

RunLock ActivityDeliveries::waitForTurn() {
  for (;;) {
    const std::optional<Date> lastRunSeen = waitUntilDue();
    std::optional<RunLock> turn = waitForLock();
    if (!turn) {
      tesselReporterLog().debug("Could not lock the state directory %@", state_.path());
      waitForRetry();
    } else if (!criteria_.interval || lastRun() == lastRunSeen) {
      return std::move(*turn);
    }
    // Else another process ran in the meantime, and the run is not due any more.
  }
}

std::optional<RunLock> ActivityDeliveries::waitForLock() {
  if (auto turn = state_.tryLock()) return turn;
  status_.say("waiting for the run of another process");
  return state_.waitForLock();
}

// Answers the last run that the decision rests on; the holder of the lock sees whether it still is.
std::optional<Date> ActivityDeliveries::waitUntilDue() {
  const std::optional<Date> seen = lastRun();
  if (!criteria_.interval) return seen;
  const uint64_t begin = clock_.continuousTicks();
  for (;;) {
    const std::chrono::nanoseconds remaining =
        waitForRun(seen, clock_.now(), *criteria_.interval, since(begin));
    if (remaining.count() == 0) return seen;
    status_.say("waiting until the next run is due");
    wait(std::min(remaining, kLongestWait));
  }
}

// The record, or a later run of this process's own that could not be recorded.
std::optional<Date> ActivityDeliveries::lastRun() const {
  return std::max(state_.lastRun(), lastRunHere_);
}

void ActivityDeliveries::record(Date begin) {
  lastRunHere_ = begin;
  if (const std::optional<std::string> error = state_.recordRun(begin)) {
    tesselReporterLog().debug("Could not record the run: %@", *error);
  }
}

void ActivityDeliveries::waitForRetry() {
  const uint64_t begin = clock_.continuousTicks();
  for (;;) {
    const std::chrono::nanoseconds remaining = criteria_.deferRetry - since(begin);
    if (remaining.count() <= 0) return;
    wait(std::min(remaining, kLongestWait));
  }
}

void ActivityDeliveries::wait(std::chrono::nanoseconds duration) {
  Semaphore never(0);
  clock_.wait(never, duration);
}

std::chrono::nanoseconds ActivityDeliveries::since(uint64_t ticks) {
  const Timebase base = clock_.timebase();
  const uint64_t nanoseconds =
      (clock_.continuousTicks() - ticks) * base.numerator / base.denominator;
  return std::chrono::nanoseconds{static_cast<int64_t>(nanoseconds)};
}

}  // namespace tessel
