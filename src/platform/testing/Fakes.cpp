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

std::vector<std::string> RecordingLog::linesUpTo(LogLevel most) const {
  const std::lock_guard lock(mutex_);
  std::vector<std::string> texts;
  for (const auto& [level, text] : lines_) {
    if (level <= most) texts.push_back(text);
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

Threads& realThreads() {
  static Threads& threads = *new StandardThreads;
  return threads;
}

void FakeClock::advance(std::chrono::nanoseconds by) {
  ticks += static_cast<uint64_t>(by.count()) * base.denominator / base.numerator;
  date += std::chrono::duration_cast<std::chrono::microseconds>(by);
}

void FakeClock::sleep(std::chrono::nanoseconds time) {
  sleeps.push_back(static_cast<uint32_t>(time / std::chrono::microseconds{1}));
  if (whileWaiting) whileWaiting();
  advance(time);
}

std::chrono::nanoseconds FakeClock::time() {
  return std::chrono::nanoseconds{static_cast<int64_t>(ticks * base.numerator / base.denominator)};
}

bool FakeClock::wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) {
  waits.push_back(timeout);
  if (whileWaiting) whileWaiting();
  if (semaphore.tryTake()) return true;
  advance(timeout);
  return false;
}

void ManualQueue::runAll() {
  while (!work_.empty()) {
    const Closure work = std::move(work_.front());
    work_.pop_front();
    work();
  }
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

std::vector<std::string> RememberingSender::names() const {
  std::vector<std::string> all;
  for (const SentEvent& event : events) all.push_back(event.name);
  return all;
}

void FakeConfigurationObserver::deliver(std::shared_ptr<const ConfigurationValue> configuration,
                                        std::string type) {
  queue->async([this, configuration = std::move(configuration), type = std::move(type)] {
    delegate->observerDidChangeConfiguration(*this, configuration, type);
  });
}

FileExistence FakeFiles::existence(const std::string& path) {
  const auto item = items.find(path);
  if (item == items.end()) return {};
  return {true, item->second};
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

}  // namespace tessel::testing
