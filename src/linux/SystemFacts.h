// What this machine says about itself: clocks, build variant, root volume and dates.

#pragma once

#include <optional>
#include <string>

#include "platform/System.h"

namespace tessel {

// The machine's clocks. Stateless; any thread.
class SystemClock final : public Clock {
 public:
  // Nanoseconds since boot, including the time asleep.
  uint64_t continuousTicks() override;
  Timebase timebase() override { return {1, 1}; }
  Date now() override;
  void sleepMicroseconds(uint32_t microseconds) override;
  bool wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) override;
};

// The value that the text of an os-release file gives `name`, without its quotes. Of several lines
// the last counts, as for a shell that reads the file. Empty if there is none. Points into `text`.
std::string_view osReleaseValue(std::string_view text, std::string_view name);

// The build variant as the os-release file tells it. The constructor reads the file once.
// Immutable; any thread may ask.
class OsReleaseBuildVariant final : public BuildVariant {
 public:
  // `path` names a file in the os-release format. The build is internal if VARIANT_ID is
  // "internal", and not if the file cannot be read or has no such line.
  explicit OsReleaseBuildVariant(const std::string& path);

  // The same for every subsystem.
  bool hasInternalDiagnostics(std::string_view subsystem) override;

 private:
  const bool internal_;
};

// The mount table. Read anew for every question; any thread.
class MountTable final : public Volumes {
 public:
  // `path` names a file in the kernel's mountinfo format.
  explicit MountTable(std::string path = "/proc/self/mountinfo") : path_(std::move(path)) {}

  // Of several mounts at "/" the topmost counts, which is the last in the table.
  std::optional<std::string> rootFilesystemTypeName() override;

 private:
  const std::string path_;
};

// Dates in this machine's locale and time zone. Immutable; any thread.
class IcuDates final : public DateFormatter {
 public:
  // The locale that the environment names for dates ($LC_ALL, $LC_TIME, $LANG), and the machine's
  // time zone at the moment of formatting.
  IcuDates();
  // A locale such as "de_DE.UTF-8" and a time zone such as "Europe/Berlin".
  IcuDates(std::string locale, std::optional<std::string> timeZone);

  std::string format(Date date) override;

 private:
  const std::string locale_;
  const std::optional<std::string> timeZone_;
};

}  // namespace tessel
