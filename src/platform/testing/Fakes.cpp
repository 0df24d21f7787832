// The fakes' few lines of work.

#include "platform/testing/Fakes.h"

#include <algorithm>
#include <stdexcept>

namespace tessel::testing {

void RecordingLog::write(LogLevel level, std::string_view, std::string_view,
                         std::string_view text) {
  const std::lock_guard lock(mutex_);
  lines_.emplace_back(level, text);
}

std::vector<std::string> RecordingLog::lines() const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  for (const auto& line : lines_) texts.push_back(line.second);
  return texts;
}

std::vector<std::string> RecordingLog::errors() const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  for (const auto& line : lines_) {
    if (line.first == LogLevel::error) texts.push_back(line.second);
  }
  return texts;
}

size_t RecordingLog::count(std::string_view text) const {
  const std::lock_guard lock(mutex_);
  return static_cast<size_t>(std::count_if(lines_.begin(), lines_.end(),
                                           [&](const auto& line) { return line.second == text; }));
}

void RecordingLog::clear() {
  const std::lock_guard lock(mutex_);
  lines_.clear();
}

void FakeClock::advance(std::chrono::nanoseconds by) {
  ticks += static_cast<uint64_t>(by.count()) * base.denominator / base.numerator;
  date += std::chrono::duration_cast<std::chrono::microseconds>(by);
}

void FakeClock::sleepMicroseconds(uint32_t microseconds) {
  sleeps.push_back(microseconds);
  advance(std::chrono::microseconds{microseconds});
}

bool FakeClock::wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) {
  waits.push_back(timeout);
  if (whileWaiting) whileWaiting();
  if (semaphore.waitFor(std::chrono::nanoseconds{0})) return true;
  advance(timeout);
  return false;
}

void ManualQueue::sync(const Closure& work) {
  runAll();
  work();
}

void ManualQueue::runAll() {
  while (!work_.empty()) {
    const Closure work = std::move(work_.front());
    work_.pop_front();
    work();
  }
}

std::shared_ptr<SerialQueue> ManualQueueFactory::makeSerialQueue(std::string label) {
  return queues.emplace_back(std::make_shared<ManualQueue>(std::move(label)));
}

std::shared_ptr<RepeatingTimer> ManualQueueFactory::makeRepeatingTimer(
    std::shared_ptr<SerialQueue> queue, std::chrono::nanoseconds interval,
    std::chrono::nanoseconds leeway, Closure handler) {
  auto timer = std::make_shared<ManualTimer>();
  timer->queue = std::move(queue);
  timer->interval = interval;
  timer->leeway = leeway;
  timer->handler = std::move(handler);
  return timers.emplace_back(std::move(timer));
}

void ManualQueueFactory::runAll() {
  for (const auto& queue : queues) queue->runAll();
}

bool FakeActivity::setState(int64_t wanted) {
  statesSet.push_back(wanted);
  if (takesStates) currentState = wanted;
  return takesStates;
}

std::unique_ptr<KeepAliveTransaction> FakeRuntime::openTransaction(const std::string& name) {
  struct Transaction final : KeepAliveTransaction {
    explicit Transaction(FakeRuntime& owner) : runtime(owner) {}
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;
    ~Transaction() override { runtime.calls.push_back("close"); }
    FakeRuntime& runtime;
  };
  calls.push_back("open " + name);
  return std::make_unique<Transaction>(*this);
}

void FakeRuntime::runMainLoop() { throw std::logic_error("the fake runtime has no main loop"); }

bool RememberingSender::sendEvent(std::string_view name, const Payload& payload) {
  if (takesEvents) events.push_back({std::string(name), payloadJson(payload)});
  return takesEvents;
}

std::vector<std::string> RememberingSender::names() const {
  std::vector<std::string> all;
  for (const SentEvent& event : events) all.push_back(event.name);
  return all;
}

void FakeConfigurationObserver::setDelegate(
    std::shared_ptr<ConfigurationObserverDelegate> delegateIn,
    std::shared_ptr<SerialQueue> queueIn) {
  delegate = std::move(delegateIn);
  queue = std::move(queueIn);
}

void FakeConfigurationObserver::deliver(std::shared_ptr<const ConfigurationValue> configuration,
                                        std::string type) {
  queue->async([this, configuration = std::move(configuration), type = std::move(type)] {
    delegate->observerDidChangeConfiguration(*this, configuration, type);
  });
}

std::shared_ptr<ConfigurationObserver> FakeConfigurationService::makeObserver() {
  return observers.emplace_back(std::make_shared<FakeConfigurationObserver>());
}

FileExistence FakeFiles::existence(const std::string& path) {
  const auto item = items.find(path);
  if (item == items.end()) return {};
  return {true, item->second};
}

bool FakeFiles::createFile(const std::string& path) {
  return canCreate && items.emplace(path, false).second;
}

RemovalResult FakeFiles::remove(const std::string& path) {
  if (removal) return *removal;
  items.erase(path);
  return {true, {}};
}

std::optional<std::string> FakeBundles::bundleIdentifier(const std::string& directory) {
  asked.push_back(directory);
  const auto found = identifiers.find(directory);
  if (found == identifiers.end()) return {};
  return found->second;
}

bool FakeBuildVariant::hasInternalDiagnostics(std::string_view subsystem) {
  ++asked;
  lastSubsystem = subsystem;
  return internal;
}

std::string FakeDates::format(Date date) {
  return std::to_string(
      std::chrono::duration_cast<std::chrono::seconds>(date.time_since_epoch()).count());
}

}  // namespace tessel::testing
