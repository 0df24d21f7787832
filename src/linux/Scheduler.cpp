// Deferral by file, battery and CPU pressure; deliveries to the activity.
//
// Several processes may use one state directory: that of the timer, a second service, one that an
// operator started. A lock and a record keep them apart.
//  - A run is delivered under an exclusive flock() on the directory. The kernel drops it when the
//    process dies, however it dies. A lock file with a process id was discarded: the file stays
//    after a kill, and the id may then belong to another process.
//  - The record says when the last run began. A run is due when that is an interval ago. While a
//    process waits for the lock, another one may run, so it then reads the record again.
// The begin counts and not the end, so that runs keep their distance however long each takes.
//
// The record is written after the run, so a run that dies is not recorded. The next process then
// starts a run at once, which finds the marker of the dead run, reads nothing and is recorded. The
// next full run comes an interval later. If the record were written first, one more interval would
// pass without a run.
//
// The wall clock may jump and the machine may sleep. No single wait therefore exceeds a minute,
// after which both clocks are read again.

#include "linux/Scheduler.h"

#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <charconv>
#include <filesystem>
#include <system_error>
#include <utility>

#include "os/Files.h"
#include "platform/Log.h"

namespace tessel {

namespace {

constexpr size_t kMaxFactSize = 4096;  // the kernel writes files of this kind into one page
// Below this most desktops warn of a low battery.
constexpr int kLowBatteryPercent = 20;
// For 80 % of the last ten seconds some task waited for the CPU. A run would lengthen such waits.
constexpr double kHighPressurePercent = 80;

// The content of a one-line file. Empty if there is none.
std::string fact(const std::string& path) {
  std::string text = readSmallFile(path, kMaxFactSize).value_or("");
  while (text.ends_with('\n')) text.pop_back();
  return text;
}

template <typename T>
std::optional<T> number(std::string_view text) {
  T value{};
  const auto [stopped, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (error != std::errc() || stopped != text.data() + text.size()) return {};
  return value;
}

std::vector<std::string> entriesOf(const std::string& directory) {
  std::vector<std::string> paths;
  std::error_code error;
  std::filesystem::directory_iterator entry(directory, error);
  const std::filesystem::directory_iterator end;
  for (; !error && entry != end; entry.increment(error)) paths.push_back(entry->path().string());
  return paths;
}

// Whether a power supply is a battery that feeds the machine. A mouse or a headset also reports a
// battery, with the scope "Device". "present" is 0 in an empty slot.
bool feedsTheMachine(const std::string& supply) {
  return fact(supply + "/type") == "Battery" && fact(supply + "/scope") != "Device" &&
         fact(supply + "/present") != "0";
}

// The number behind "avg10=" in the line "some". The line "full" has such a number too, but for the
// CPU of a whole machine it is always zero.
std::optional<double> someAverage10(std::string_view text) {
  constexpr std::string_view kBefore = "some avg10=";
  const size_t at = text.starts_with(kBefore) ? 0 : text.find("\nsome avg10=");
  if (at == std::string_view::npos) return {};
  text.remove_prefix(text.find(kBefore, at) + kBefore.size());
  return number<double>(text.substr(0, text.find_first_of(" \n")));
}

}  // namespace

DeferralConditions::DeferralConditions(DeferSources sources, std::string deferFile,
                                       std::string powerSupplyDirectory, std::string pressureFile)
    : sources_(sources),
      deferFile_(std::move(deferFile)),
      powerSupplyDirectory_(std::move(powerSupplyDirectory)),
      pressureFile_(std::move(pressureFile)) {}

DeferReason DeferralConditions::byFile() const {
  return sources_.file && deferFileExists() ? DeferReason::file : DeferReason::none;
}

DeferReason DeferralConditions::byMachine() const {
  if (sources_.battery && batteryIsLow()) return DeferReason::battery;
  if (sources_.pressure && cpuIsUnderPressure()) return DeferReason::pressure;
  return DeferReason::none;
}

std::string DeferralConditions::words(DeferReason reason) const {
  switch (reason) {
    case DeferReason::none:
      break;
    case DeferReason::file:
      return deferFile_ + " exists";
    case DeferReason::battery:
      return "the battery is low";
    case DeferReason::pressure:
      return "the CPU is under pressure";
    case DeferReason::runLimit:
      return "it has taken as long as TESSEL_RUN_LIMIT allows";
  }
  return "no reason";
}

bool DeferralConditions::deferFileExists() const {
  // lstat, because a broken link counts as the file too.
  struct stat facts {};
  return ::lstat(deferFile_.c_str(), &facts) == 0;
}

// A machine with several batteries empties one after another. So the machine is low on charge only
// if all its batteries are low.
bool DeferralConditions::batteryIsLow() const {
  bool discharging = false;
  for (const std::string& supply : entriesOf(powerSupplyDirectory_)) {
    if (!feedsTheMachine(supply)) continue;
    const std::optional<int> percent = number<int>(fact(supply + "/capacity"));
    if (!percent || *percent >= kLowBatteryPercent) return false;
    discharging = discharging || fact(supply + "/status") == "Discharging";
  }
  return discharging;
}

bool DeferralConditions::cpuIsUnderPressure() const {
  const std::optional<std::string> text = readSmallFile(pressureFile_, kMaxFactSize);
  return text && someAverage10(*text).value_or(0) > kHighPressurePercent;
}

namespace {

// The longest single wait. A wait does not notice that the wall clock was set or that the machine
// slept, so both clocks are read again this often.
constexpr std::chrono::nanoseconds kLongestWait = std::chrono::minutes{1};

std::chrono::nanoseconds timeSince(uint64_t ticks, Clock& clock) {
  const Timebase base = clock.timebase();
  const uint64_t nanoseconds =
      (clock.continuousTicks() - ticks) * base.numerator / base.denominator;
  return std::chrono::nanoseconds{static_cast<int64_t>(nanoseconds)};
}

// One delivery to the activity. Several threads of the service use it at the same time. The poll of
// a run keeps it for as long as the process lives, hence atomics: a mutex would be the largest part
// of what a past run costs. After end() it takes no state any more and never wants a deferral,
// because the slot has been given back.
class Delivery final : public Activity {
 public:
  Delivery(int64_t state, const DeferralConditions& conditions, Clock& clock,
           std::chrono::seconds runLimit, bool machineMayDefer)
      : conditions_(conditions),
        clock_(clock),
        begin_(clock.continuousTicks()),
        runLimit_(runLimit),
        state_(state),
        machineMayDefer_(machineMayDefer) {}

  int64_t state() override { return state_ & ~kOver; }
  bool shouldDefer() override {
    if ((state_ & kOver) != 0) return false;
    // The first question comes before the run begins, and all others from the run.
    const bool begun = asked_.exchange(true);
    const DeferReason reason = begun ? reasonToStop() : reasonToWait();
    if (reason == DeferReason::none) return false;
    const DeferReason before = reason_.exchange(reason);
    if (begun && before != reason)
      platformLog().warning("The run is stopped early: %@", conditions_.words(reason));
    return true;
  }
  bool setState(int64_t wanted) override {
    int64_t expected = kActivityStateRun;
    return wanted == kActivityStateDefer && state_.compare_exchange_strong(expected, wanted);
  }
  // Makes every later setState() fail. Answers why the run was deferred, or nothing if it was not.
  std::optional<DeferReason> end() {
    if (state_.fetch_or(kOver) != kActivityStateDefer) return {};
    return reason_;
  }

 private:
  static constexpr int64_t kOver = 256;  // a bit that no state has

  DeferReason reasonToWait() const {
    const DeferReason reason = conditions_.byFile();
    if (reason != DeferReason::none || !machineMayDefer_) return reason;
    return conditions_.byMachine();
  }
  DeferReason reasonToStop() const {
    const DeferReason reason = conditions_.byFile();
    if (reason != DeferReason::none || runLimit_.count() == 0) return reason;
    return timeSince(begin_, clock_) > runLimit_ ? DeferReason::runLimit : DeferReason::none;
  }

  const DeferralConditions& conditions_;
  Clock& clock_;
  const uint64_t begin_;
  const std::chrono::seconds runLimit_;
  std::atomic<int64_t> state_;
  const bool machineMayDefer_;
  std::atomic<bool> asked_{false};
  std::atomic<DeferReason> reason_{DeferReason::none};
};

}  // namespace

BackgroundScheduler::BackgroundScheduler(ScheduleCriteria criteria, const StateDirectory& state,
                                         const DeferralConditions& conditions,
                                         ServiceRuntime& runtime, ServiceStatus& status,
                                         Clock& clock, Threads& threads)
    : criteria_(criteria),
      state_(state),
      conditions_(conditions),
      runtime_(runtime),
      status_(status),
      clock_(clock),
      threads_(threads) {}

void BackgroundScheduler::registerActivity(const std::string& /*name*/, ActivityHandler handler) {
  // The process must not end while a delivery is pending. `pending` keeps it alive until the thread
  // ends.
  const std::shared_ptr<KeepAliveTransaction> pending = runtime_.expectDelivery();
  const auto deliveries = std::make_shared<ActivityDeliveries>(
      criteria_, state_, conditions_, status_, clock_, threads_, std::move(handler));
  startThread(threads_, [pending, deliveries] {
    deliveries->deliverCheckIn();
    while (deliveries->deliverRun()) {
    }
  });
}

ActivityDeliveries::ActivityDeliveries(ScheduleCriteria criteria, const StateDirectory& state,
                                       const DeferralConditions& conditions, ServiceStatus& status,
                                       Clock& clock, Threads& threads, ActivityHandler handler)
    : criteria_(criteria),
      state_(state),
      conditions_(conditions),
      status_(status),
      clock_(clock),
      threads_(threads),
      handler_(std::move(handler)),
      putOffByMachine_(state.putOff()) {}

void ActivityDeliveries::deliverCheckIn() {
  const auto delivery = std::make_shared<Delivery>(kActivityStateCheckIn, conditions_, clock_,
                                                   criteria_.runLimit, false);
  handler_(delivery);
  delivery->end();
}

bool ActivityDeliveries::deliverRun() {
  std::optional<RunLock> turn = waitForTurn();
  recordPutOff(putOffByMachine_);
  const Date begin = clock_.now();
  const auto delivery = std::make_shared<Delivery>(kActivityStateRun, conditions_, clock_,
                                                   criteria_.runLimit, machineMayDefer());
  handler_(delivery);
  if (const std::optional<DeferReason> reason = delivery->end()) {
    const std::chrono::nanoseconds wait = planWait(*reason);
    // Give the lock back before the wait, so that another process can run meanwhile.
    turn.reset();
    putOff(*reason, wait);
    return true;
  }
  record(begin);
  return criteria_.interval.has_value();
}

// How long to wait until a deferred run is offered again. The process may end while it waits, for
// example when the machine is switched off. So a wait that the machine asked for is recorded before
// it begins, as if it had passed. Otherwise a machine that is never on for a whole wait would never
// report. The price is that a wait which was cut off counts in full.
std::chrono::nanoseconds ActivityDeliveries::planWait(DeferReason reason) const {
  if (!isOfTheMachine(reason)) return criteria_.deferRetry;
  // The last wait is cut, so that the run begins when the limit is reached and not a retry later.
  const std::chrono::nanoseconds wait = std::min<std::chrono::nanoseconds>(
      criteria_.deferRetry, criteria_.deferLimit - putOffByMachine_);
  recordPutOff(putOffByMachine_ + wait);
  return wait;
}

void ActivityDeliveries::putOff(DeferReason reason, std::chrono::nanoseconds wait) {
  status_.say("run deferred: " + conditions_.words(reason));
  warnOnce(reason);
  const uint64_t begin = clock_.continuousTicks();
  waitFor(wait);
  if (isOfTheMachine(reason)) putOffByMachine_ += timeSince(begin, clock_);
}

// REQUIRES: the caller holds the lock. If this fails, the next process counts from the last record
// on.
void ActivityDeliveries::recordPutOff(std::chrono::nanoseconds time) const {
  const auto seconds = std::chrono::ceil<std::chrono::seconds>(time);
  if (state_.putOff() != seconds) state_.recordPutOff(seconds);
}

void ActivityDeliveries::warnOnce(DeferReason reason) {
  if (std::find(warnedOf_.begin(), warnedOf_.end(), reason) != warnedOf_.end()) return;
  warnedOf_.push_back(reason);
  platformLog().warning("The run is put off: %@", conditions_.words(reason));
}

RunLock ActivityDeliveries::waitForTurn() {
  for (;;) {
    const std::optional<Date> lastRunSeen = waitUntilDue();
    std::optional<RunLock> turn = waitForLock();
    if (!turn) {
      tesselReporterLog().debug("Could not lock the state directory %@", state_.path());
      waitFor(criteria_.deferRetry);
    } else if (!criteria_.interval || lastRun() == lastRunSeen) {
      return std::move(*turn);
    }
    // Otherwise another process ran while we waited for the lock, so our run is no longer due.
  }
}

std::optional<RunLock> ActivityDeliveries::waitForLock() {
  if (auto turn = state_.tryLock()) return turn;
  status_.say("waiting for the run of another process");
  return state_.waitForLock();
}

// Answers the last run that it has seen. Once the caller has the lock, it compares: a later run
// means that ours is no longer due.
std::optional<Date> ActivityDeliveries::waitUntilDue() {
  const std::optional<Date> seen = lastRun();
  if (!criteria_.interval) return seen;
  const uint64_t begin = clock_.continuousTicks();
  for (;;) {
    const std::chrono::nanoseconds remaining =
        waitForRun(seen, clock_.now(), *criteria_.interval, timeSince(begin, clock_));
    if (remaining.count() == 0) return seen;
    status_.say("waiting until the next run is due");
    threads_.sleep(std::min(remaining, kLongestWait));
  }
}

// The recorded run, or a later one of this process. If the directory cannot be written, the record
// stays old, and without lastRunHere_ the service would run again and again.
std::optional<Date> ActivityDeliveries::lastRun() const {
  return std::max(state_.lastRun(), lastRunHere_);
}

void ActivityDeliveries::record(Date begin) {
  lastRunHere_ = begin;
  warnedOf_.clear();
  putOffByMachine_ = {};
  recordPutOff(putOffByMachine_);
  if (const auto error = state_.recordRun(begin)) {
    tesselReporterLog().debug("Could not record the run: %@", error->words);
  }
}

void ActivityDeliveries::waitFor(std::chrono::nanoseconds duration) {
  const uint64_t begin = clock_.continuousTicks();
  for (;;) {
    const std::chrono::nanoseconds remaining = duration - timeSince(begin, clock_);
    if (remaining.count() <= 0) return;
    threads_.sleep(std::min(remaining, kLongestWait));
  }
}

}  // namespace tessel
