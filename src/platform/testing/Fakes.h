// Small working fakes of the platform's roles, with switches. For tests only.

#pragma once

#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/Analytics.h"
#include "platform/Log.h"
#include "platform/Queues.h"
#include "platform/System.h"

namespace tessel::testing {

// Remembers log lines while it lives; takes the place of the sink that was installed.
class RecordingLog final : public LogSink {
 public:
  explicit RecordingLog(LogLevel level = LogLevel::debug) { setLogSink(this, level); }
  ~RecordingLog() override { setLogSink(nullptr, LogLevel::error); }

  void write(LogLevel level, std::string_view subsystem, std::string_view category,
             std::string_view text) override;
  std::vector<std::string> lines() const { return linesUpTo(LogLevel::debug); }
  std::vector<std::string> errors() const { return linesUpTo(LogLevel::error); }
  // How many lines read exactly `text`.
  size_t count(std::string_view text) const;
  void clear();

 private:
  std::vector<std::string> linesUpTo(LogLevel most) const;

  mutable std::mutex mutex_;
  std::vector<std::pair<LogLevel, std::string>> lines_;
};

// Real threads. Never destroyed, because the threads of pools and timers outlive every test.
Threads& realThreads();

// A clock in nanosecond ticks that moves only when told to, by a sleep or by a wait that times out.
// Both are its own, so it is the role of threads as well. What it starts is a real thread.
class FakeClock final : public Clock, public Threads {
 public:
  uint64_t continuousTicks() override { return ticks; }
  Timebase timebase() override { return base; }
  Date now() override { return date; }
  bool start(const Closure& body) override { return realThreads().start(body); }
  void sleep(std::chrono::nanoseconds time) override;
  std::chrono::nanoseconds time() override;
  // Runs `whileWaiting`, as sleep() does, then advances by the whole timeout where nothing was
  // signalled.
  bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) override;
  void advance(std::chrono::nanoseconds by);

  uint64_t ticks = 1'000'000'000;
  Timebase base{1, 1};
  Date date{std::chrono::seconds{1'795'000'000}};
  std::vector<uint32_t> sleeps;  // microseconds
  std::vector<std::chrono::nanoseconds> waits;
  Closure whileWaiting;
};

// A queue that runs what it holds when told to. sync() runs everything before it, too.
class ManualQueue final : public SerialQueue {
 public:
  explicit ManualQueue(std::string label) : label_(std::move(label)) {}
  const std::string& label() const override { return label_; }
  void async(Closure work) override { work_.push_back(std::move(work)); }
  void sync(const Closure& work) override {
    runAll();
    work();
  }
  // Runs what is queued, and what that queues.
  void runAll();
  size_t pending() const { return work_.size(); }

 private:
  const std::string label_;
  std::deque<Closure> work_;
};

struct ManualTimer final : RepeatingTimer {
  void resume() override { resumed = true; }
  // Submits the handler to the queue, as a firing does.
  void fire() { queue->async(handler); }

  std::shared_ptr<SerialQueue> queue;
  std::chrono::nanoseconds interval{};
  std::chrono::nanoseconds leeway{};
  Closure handler;
  bool resumed = false;
};

struct ManualQueueFactory final : QueueFactory {
  std::shared_ptr<SerialQueue> makeSerialQueue(std::string label) override {
    return queues.emplace_back(std::make_shared<ManualQueue>(std::move(label)));
  }
  std::shared_ptr<RepeatingTimer> makeRepeatingTimer(std::shared_ptr<SerialQueue> queue,
                                                     std::chrono::nanoseconds interval,
                                                     std::chrono::nanoseconds leeway,
                                                     Closure handler) override;
  void runAll() {
    for (const auto& queue : queues) queue->runAll();
  }

  std::vector<std::shared_ptr<ManualQueue>> queues;
  std::vector<std::shared_ptr<ManualTimer>> timers;
};

struct FakeActivity final : Activity {
  int64_t state() override { return currentState; }
  bool shouldDefer() override { return deferWanted; }
  bool setState(int64_t wanted) override {
    statesSet.push_back(wanted);
    if (takesStates) currentState = wanted;
    return takesStates;
  }

  int64_t currentState = kActivityStateRun;
  bool deferWanted = false;
  bool takesStates = true;
  std::vector<int64_t> statesSet;
};

// Remembers what was asked of it, in order, in `calls`.
struct FakeRuntime final : Runtime {
  std::unique_ptr<KeepAliveTransaction> openTransaction(const std::string& name) override;
  void requestCleanExit() override { calls.push_back("clean exit"); }
  std::shared_ptr<SignalSource> makeSignalSource(int, std::shared_ptr<SerialQueue>) override {
    return nullptr;
  }
  [[noreturn]] void runMainLoop() override;

  std::vector<std::string> calls;
};

// Remembers what the process said it was doing.
struct FakeServiceStatus final : ServiceStatus {
  void say(std::string_view words) override { said.emplace_back(words); }
  void progress() override { ++steps; }

  std::vector<std::string> said;
  size_t steps = 0;
};

struct SentEvent {
  std::string name;
  std::string json;
};

// An analytics service that remembers.
struct RememberingSender final : EventSender {
  bool sendEvent(std::string_view name, const Payload& payload, EventRank /*rank*/) override {
    events.push_back({std::string(name), payloadJson(payload)});
    return true;
  }
  std::vector<std::string> names() const;

  std::vector<SentEvent> events;
};

struct FakeConfigurationObserver final : ConfigurationObserver {
  void setDelegate(std::shared_ptr<ConfigurationObserverDelegate> delegateIn,
                   std::shared_ptr<SerialQueue> queueIn) override {
    delegate = std::move(delegateIn);
    queue = std::move(queueIn);
  }
  void startObserving(const std::string& type) override { observed.push_back(type); }
  // Submits one call to the delegate on its queue.
  void deliver(std::shared_ptr<const ConfigurationValue> configuration, std::string type);

  std::shared_ptr<ConfigurationObserverDelegate> delegate;
  std::shared_ptr<SerialQueue> queue;
  std::vector<std::string> observed;
};

struct FakeConfigurationService final : ConfigurationService {
  std::shared_ptr<ConfigurationObserver> makeObserver() override {
    return observers.emplace_back(std::make_shared<FakeConfigurationObserver>());
  }
  std::vector<std::shared_ptr<FakeConfigurationObserver>> observers;
};

struct FakeFiles final : FileManager {
  FileExistence existence(const std::string& path) override;
  std::optional<PlatformError> createFile(const std::string& path) override {
    if (canCreate && items.emplace(path, false).second) return {};
    return PlatformError{ErrorCode::failed, path + ": Disk full"};
  }
  RemovalResult remove(const std::string& path) override;

  std::map<std::string, bool> items;  // path to "is a directory"
  bool canCreate = true;
  std::optional<RemovalResult> removal;  // what a removal answers instead of removing
};

struct FakeVolumes final : Volumes {
  std::optional<std::string> rootFilesystemTypeName() override { return type; }
  std::optional<std::string> type = "ext4";
};

struct FakeBundles final : BundleReader {
  std::optional<std::string> bundleIdentifier(const std::string& directory) override;
  std::map<std::string, std::string> identifiers;
  std::vector<std::string> asked;
};

struct FakeBuildVariant final : BuildVariant {
  bool hasInternalDiagnostics(std::string_view subsystem) override {
    ++asked;
    lastSubsystem = subsystem;
    return internal;
  }
  bool internal = false;
  size_t asked = 0;
  std::string lastSubsystem;
};

// Formats a date as its seconds since 1970.
struct FakeDates final : DateFormatter {
  std::string format(Date date) override {
    const auto since1970 = date.time_since_epoch();
    return std::to_string(std::chrono::duration_cast<std::chrono::seconds>(since1970).count());
  }
};

}  // namespace tessel::testing
