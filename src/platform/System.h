// The roles that the service needs of the system (clocks, files, facts about the machine) and of
// its surroundings (the activity scheduler, the process runtime, the service manager).

#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Queues.h"

namespace tessel {

// Wall-clock date, microseconds since 1970, UTC.
using Date = std::chrono::sys_time<std::chrono::microseconds>;

// Nanoseconds per tick, as a fraction.
struct Timebase {
  uint32_t numerator;
  uint32_t denominator;
};

class Clock {
 public:
  virtual ~Clock() = default;
  // Native ticks of the monotonic clock that keeps counting while the machine sleeps.
  virtual uint64_t continuousTicks() = 0;
  virtual Timebase timebase() = 0;
  virtual Date now() = 0;
};

struct FileExistence {
  bool exists = false;
  bool isDirectory = false;
};

struct RemovalResult {
  bool removed = false;
  // Why not. Absent if the system gave no reason.
  std::optional<PlatformError> error;
};

class FileManager {
 public:
  virtual ~FileManager() = default;
  // Looks at the path itself: a link is a file, whatever it points to.
  virtual FileExistence existence(const std::string& path) = 0;
  // Creates an empty file. Absent if that succeeded. It fails if anything stands at the path.
  virtual std::optional<PlatformError> createFile(const std::string& path) = 0;
  // Removes a file, a link, or a directory with its content. Follows no link.
  virtual RemovalResult remove(const std::string& path) = 0;
};

class Volumes {
 public:
  virtual ~Volumes() = default;
  // The name of the file system type that is mounted at "/", as raw bytes. Absent if unknown.
  virtual std::optional<std::string> rootFilesystemTypeName() = 0;
};

class BundleReader {
 public:
  virtual ~BundleReader() = default;
  // The identifier of the bundle at `directory`. Absent if it is no bundle or has no identifier.
  virtual std::optional<std::string> bundleIdentifier(const std::string& directory) = 0;
};

class BuildVariant {
 public:
  virtual ~BuildVariant() = default;
  // Whether this build carries internal diagnostics for a subsystem. Cheap, because the service
  // asks for every object.
  virtual bool hasInternalDiagnostics(std::string_view subsystem) = 0;
};

class DateFormatter {
 public:
  virtual ~DateFormatter() = default;
  // The date in short form and the time in medium form, in the current locale and time zone.
  virtual std::string format(Date date) = 0;
};

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
  // False if the scheduler does not take the state.
  virtual bool setState(int64_t state) = 0;
};

using ActivityHandler = std::function<void(const std::shared_ptr<Activity>&)>;

class ActivityScheduler {
 public:
  virtual ~ActivityScheduler() = default;
  // Registers for check-in, with the criteria of the launch configuration. The scheduler calls the
  // handler on a thread of its own, never twice at a time.
  virtual void registerActivity(const std::string& name, ActivityHandler handler) = 0;
};

// While a transaction is open, the process is not ended as idle. Destroying the object closes it.
class KeepAliveTransaction {
 public:
  virtual ~KeepAliveTransaction() = default;
};

// Delivers a signal as a closure on a queue. It delivers nothing until it is resumed.
class SignalSource {
 public:
  virtual ~SignalSource() = default;
  virtual void setHandler(Closure handler) = 0;
  virtual void resume() = 0;
};

class Runtime {
 public:
  virtual ~Runtime() = default;
  virtual std::unique_ptr<KeepAliveTransaction> openTransaction(const std::string& name) = 0;
  // Lets the process end with status 0 as soon as no transaction is open and no delivery is
  // pending.
  virtual void requestCleanExit() = 0;
  virtual std::shared_ptr<SignalSource> makeSignalSource(int signalNumber,
                                                         std::shared_ptr<SerialQueue> queue) = 0;
  [[noreturn]] virtual void runMainLoop() = 0;
};

// Tells the service manager what the process is doing and that it makes progress. Any thread.
class ServiceStatus {
 public:
  virtual ~ServiceStatus() = default;
  // What the process is doing now, in a few words for a human: "reading the trace store".
  virtual void say(std::string_view words) = 0;
  // Says that work moved on by a step. Cheap enough for every trace object: most calls only read a
  // clock. A process that works and does not call it for a minute and a watchdog period is taken
  // for hung, and the manager kills it.
  virtual void progress() = 0;
};

}  // namespace tessel
