// Questions to the system: clocks, files, the root volume, bundles, the build variant, dates.

#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

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
  virtual void sleepMicroseconds(uint32_t microseconds) = 0;
  // Waits on `semaphore`. False if `timeout` passed first.
  virtual bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) = 0;
};

struct FileExistence {
  bool exists = false;
  bool isDirectory = false;
};

struct RemovalResult {
  bool removed = false;
  // Why not, in words. Absent if the system gave no reason.
  std::optional<std::string> error;
};

class FileManager {
 public:
  virtual ~FileManager() = default;
  // Looks at the path itself: a link is a file, whatever it points to.
  virtual FileExistence existence(const std::string& path) = 0;
  // Creates an empty file. False if anything stands at the path already, or on failure.
  virtual bool createFile(const std::string& path) = 0;
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

}  // namespace tessel
