// What this machine says about itself: clocks, build variant, root volume and dates.

#pragma once

#include <atomic>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>

#include "os/UniqueFd.h"
#include "platform/System.h"

namespace tessel {

// The machine's clocks. Stateless; any thread.
class SystemClock final : public Clock {
 public:
  // Nanoseconds since boot, including the time asleep.
  uint64_t continuousTicks() override;
  Timebase timebase() override { return {1, 1}; }
  Date now() override;
};

// The boot that this machine is in. Any thread.
struct Boot {
  std::string id;  // another one for each boot; empty if the kernel does not tell it
  Date began{};    // by the wall clock as it is set now; the time asleep counts
  std::chrono::seconds upFor{};
};
Boot thisBoot();

// What the service manager says about a timer.
struct TimerAnswer {
  bool answered = false;
  std::optional<Date> next;  // when it elapses; absent if it is not active
};
// Waits up to a second for the answer. Any thread.
TimerAnswer askTimer(const std::string& timer);

// The value that the text of an os-release file gives `name`, without its quotes. Of several lines
// the last counts, as for a shell that reads the file. Empty if there is none. Points into `text`.
std::string_view osReleaseValue(std::string_view text, std::string_view name);

// The build variant as the os-release file tells it. The service asks for every object, and a
// process may stay for months while the file changes. So the answer is at most a second old, and
// an answer costs a look at the clock. Any thread may ask.
class OsReleaseBuildVariant final : public BuildVariant {
 public:
  // `path` names a file in the os-release format. The build is internal if VARIANT_ID is
  // "internal", and not if the file cannot be read or has no such line. `clock` counts milliseconds
  // and never goes back.
  using Clock = int64_t (*)();
  explicit OsReleaseBuildVariant(std::string path, Clock clock = coarseMilliseconds);

  // The same for every subsystem.
  bool hasInternalDiagnostics(std::string_view subsystem) override;

 private:
  static int64_t coarseMilliseconds();
  bool readAgain(int64_t now);

  const std::string path_;
  const Clock clock_;
  std::mutex reading_;
  std::atomic<bool> internal_{false};
  std::atomic<int64_t> staleFrom_{0};  // the first moment at which the answer is too old
};

// The kernel's mount table. It is read again when the kernel says that it changed. One thread at a
// time.
//
// Local types are those of disks, of memory and of images on them. A mount of any other type may
// belong to a server, and a server that is gone blocks whoever touches the mount, even beyond
// SIGKILL. autofs counts as not local, because a touch can start a mount.
class MountTable final : public Volumes {
 public:
  // `path` names a file in the kernel's mountinfo format. Only the kernel's own file tells of
  // changes.
  explicit MountTable(std::string path = "/proc/self/mountinfo") : path_(std::move(path)) {}

  // The type of the mount that "/" belongs to by its id. If the table lacks the id, the last mount
  // at "/" counts, which is the topmost.
  std::optional<std::string> rootFilesystemTypeName() override;

  // Whether nothing but a local type is mounted right at `path`, which is absolute and has no
  // links. Does not touch the path. The mount above it is not looked at.
  bool mayStepOnto(const std::string& path);
  // Whether an open file lies on a mount of a local type. Does not touch its file system.
  bool isLocal(int fd);

 private:
  void refresh();

  const std::string path_;
  UniqueFd watched_;  // the open table, which the kernel marks when a mount comes or goes
  std::unordered_map<uint64_t, std::string> typeOfMount_;  // by mount id
  std::unordered_map<std::string, std::string> typeAt_;    // by mount point; the topmost mount's
};

// Dates in this machine's locale and time zone. Immutable; any thread.
class IcuDates final : public DateFormatter {
 public:
  // The locale that the environment names for dates ($LC_ALL, $LC_TIME, $LANG).
  IcuDates();
  // A locale such as "de_DE.UTF-8".
  explicit IcuDates(std::string locale) : locale_(std::move(locale)) {}

  // In the machine's time zone at the moment of formatting.
  std::string format(Date date) override;

 private:
  const std::string locale_;
};

}  // namespace tessel
