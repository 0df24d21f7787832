// Questions to the system: clocks, files, the root volume, bundles, the build variant, dates.

#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Queues.h"

namespace tessel {

// Clock: ticks that keep counting during sleep, the wall clock, and waiting.

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
  // Waits on `semaphore`; false where it timed out, `timeout` after the call.
  virtual bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) = 0;
};

// Small questions to the system: files, the root volume, bundles, the build variant, dates.

struct FileExistence {
  bool exists = false;
  bool isDirectory = false;
};

struct RemovalResult {
  bool removed = false;
  // Why not, in words; absent where the system gave no reason.
  std::optional<std::string> error;
};

class FileManager {
 public:
  virtual ~FileManager() = default;
  // A link counts as what it is, not as what it points to.
  virtual FileExistence existence(const std::string& path) = 0;
  // Creates an empty file; false where anything stands at the path already or it cannot be made.
  virtual bool createFile(const std::string& path) = 0;
  // Removes a file, a link, or a directory with all that is in it, following no link.
  virtual RemovalResult remove(const std::string& path) = 0;
};

class Volumes {
 public:
  virtual ~Volumes() = default;
  // Name of the filesystem type mounted at "/", as raw bytes; nothing where it cannot be told.
  virtual std::optional<std::string> rootFilesystemTypeName() = 0;
};

class BundleReader {
 public:
  virtual ~BundleReader() = default;
  // Identifier of the bundle at `directory`; nothing where it is no bundle or has none.
  virtual std::optional<std::string> bundleIdentifier(const std::string& directory) = 0;
};

class BuildVariant {
 public:
  virtual ~BuildVariant() = default;
  // Whether this build carries internal diagnostics for a subsystem. Cheap: asked for every object.
  virtual bool hasInternalDiagnostics(std::string_view subsystem) = 0;
};

class DateFormatter {
 public:
  virtual ~DateFormatter() = default;
  // Short date and medium time in the current locale and time zone.
  virtual std::string format(Date date) = 0;
};

}  // namespace tessel
