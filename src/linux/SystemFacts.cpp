// Clocks, os-release, mountinfo and ICU.
//
// In a container every one of these sources may be missing or strange. So no question here fails:
// each has an answer for "unknown".

#include "linux/SystemFacts.h"

#include <fcntl.h>
#include <poll.h>
#include <systemd/sd-bus.h>
#include <unicode/datefmt.h>
#include <unicode/locid.h>
#include <unicode/simpletz.h>

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <memory>
#include <sstream>
#include <utility>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

uint64_t SystemClock::continuousTicks() {
  // CLOCK_MONOTONIC stands still while the machine sleeps. With it a run could come a night late.
  timespec time{};
  clock_gettime(CLOCK_BOOTTIME, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(time.tv_nsec);
}

Date SystemClock::now() {
  return std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
}

Boot thisBoot() {
  SystemClock clock;
  const auto upFor = std::chrono::nanoseconds{static_cast<int64_t>(clock.continuousTicks())};
  std::string id(trimmed(readSmallFile("/proc/sys/kernel/random/boot_id", 64).value_or("")));
  return {std::move(id), clock.now() - std::chrono::floor<Date::duration>(upFor),
          std::chrono::floor<std::chrono::seconds>(upFor)};
}

namespace {

struct CloseBus {
  void operator()(sd_bus* bus) const { sd_bus_flush_close_unref(bus); }
};
using Bus = std::unique_ptr<sd_bus, CloseBus>;

Bus systemBus() {
  sd_bus* bus = nullptr;
  if (sd_bus_open_system(&bus) >= 0) return Bus(bus);
  // A small machine has no message bus. Root can then ask the manager itself.
  Bus direct(sd_bus_new(&bus) >= 0 ? bus : nullptr);
  if (direct && (sd_bus_set_address(direct.get(), "unix:path=/run/systemd/private") < 0 ||
                 sd_bus_start(direct.get()) < 0)) {
    return {};
  }
  return direct;
}

// The object of a unit: its name, with every byte but letters and digits as _ and two hexadecimal
// digits.
std::string objectOf(const std::string& unit) {
  char* path = nullptr;
  if (sd_bus_path_encode("/org/freedesktop/systemd1/unit", unit.c_str(), &path) < 0) return {};
  const std::unique_ptr<char, decltype(&std::free)> freed(path, &std::free);
  return path;
}

}  // namespace

TimerAnswer askTimer(const std::string& timer) {
  const Bus bus = systemBus();
  const std::string object = objectOf(timer);
  if (!bus || object.empty()) return {};
  sd_bus_set_method_call_timeout(bus.get(), 1'000'000);
  uint64_t next = 0;  // microseconds since 1970; 0 or the greatest number: it does not elapse
  if (sd_bus_get_property_trivial(bus.get(), "org.freedesktop.systemd1", object.c_str(),
                                  "org.freedesktop.systemd1.Timer", "NextElapseUSecRealtime",
                                  nullptr, 't', &next) < 0)
    return {};
  if (next == 0 || next > INT64_MAX) return {true, {}};
  return {true, Date{std::chrono::microseconds{static_cast<int64_t>(next)}}};
}

namespace {

constexpr size_t kMaxOsReleaseSize = size_t{64} << 10;  // usual ones have half a kilobyte

std::string_view withoutQuotes(std::string_view value) {
  const bool quoted =
      value.size() >= 2 && (value[0] == '"' || value[0] == '\'') && value.back() == value[0];
  return quoted ? value.substr(1, value.size() - 2) : value;
}

}  // namespace

std::string_view osReleaseValue(std::string_view text, std::string_view name) {
  std::string_view value;
  while (!text.empty()) {
    std::string_view line = text.substr(0, text.find('\n'));
    text.remove_prefix(std::min(line.size() + 1, text.size()));
    if (!line.starts_with(name) || line.substr(name.size(), 1) != "=") continue;
    line.remove_prefix(name.size() + 1);
    const size_t end = line.find_last_not_of(" \t\r");
    value = withoutQuotes(line.substr(0, end == std::string_view::npos ? 0 : end + 1));
  }
  return value;
}

OsReleaseBuildVariant::OsReleaseBuildVariant(std::string path, Clock clock)
    : path_(std::move(path)), clock_(clock) {
  readAgain(clock_());
}

// The coarse clock is read without a system call on every machine. The exact clocks are not: under
// some hypervisors each reading enters the kernel. It moves in steps of at most 10 ms.
int64_t OsReleaseBuildVariant::coarseMilliseconds() {
  timespec time{};
  clock_gettime(CLOCK_MONOTONIC_COARSE, &time);
  return int64_t{time.tv_sec} * 1000 + time.tv_nsec / 1'000'000;
}

bool OsReleaseBuildVariant::hasInternalDiagnostics(std::string_view /*subsystem*/) {
  const int64_t now = clock_();
  if (now < staleFrom_.load(std::memory_order_acquire)) [[likely]]
    return internal_.load(std::memory_order_relaxed);
  return readAgain(now);
}

// Watching the file with inotify was discarded: it takes a thread or a system call per question,
// and it misses a file that is replaced under another mount.
bool OsReleaseBuildVariant::readAgain(int64_t now) {
  // Less than a second by two steps of the coarse clock.
  constexpr int64_t kMaxAgeMilliseconds = 980;
  // Threads that ask meanwhile wait for the new answer, because the old one is already too old.
  const std::lock_guard lock(reading_);
  if (now < staleFrom_.load(std::memory_order_relaxed)) return internal_;
  const std::string text = readSmallFile(path_, kMaxOsReleaseSize).value_or("");
  const bool internal = osReleaseValue(text, "VARIANT_ID") == "internal";
  internal_.store(internal, std::memory_order_relaxed);
  // `now` was read before the file, so the answer is never older than we think.
  staleFrom_.store(now + kMaxAgeMilliseconds, std::memory_order_release);
  return internal;
}

namespace {

bool isOctal(char digit) { return digit >= '0' && digit <= '7'; }

// The kernel writes a blank or a backslash in a field as \ooo, so that blanks separate fields.
std::string unescaped(std::string_view field) {
  std::string out;
  for (size_t i = 0; i < field.size(); ++i) {
    if (field[i] == '\\' && i + 3 < field.size() && isOctal(field[i + 1]) &&
        isOctal(field[i + 2]) && isOctal(field[i + 3])) {
      out += static_cast<char>((field[i + 1] - '0') * 64 + (field[i + 2] - '0') * 8 +
                               (field[i + 3] - '0'));
      i += 3;
    } else {
      out += field[i];
    }
  }
  return out;
}

struct Mount {
  uint64_t id = 0;
  std::string point;
  std::string type;
};

// One line of the table, which reads
//   ID parent device root MOUNT-POINT options [optional...] - TYPE source options
// The number of optional fields varies, so we skip to the dash.
std::optional<Mount> mountOf(const std::string& line) {
  std::istringstream fields(line);
  Mount mount;
  std::string field;
  fields >> mount.id;
  for (int i = 0; i < 4; ++i) fields >> mount.point;
  while (fields >> field && field != "-") {
  }
  if (!(fields >> mount.type)) return {};
  mount.point = unescaped(mount.point);
  mount.type = unescaped(mount.type);
  return mount;
}

// A type that is not in this list is never touched. FUSE, 9p and virtiofs are missing because they
// ask a program or a host for every answer. overlay is in because containers stand on it.
constexpr std::string_view kLocalTypes[] = {
    "bcachefs", "btrfs", "cramfs",  "erofs",   "exfat",    "ext2",  "ext3",   "ext4",
    "f2fs",     "hfs",   "hfsplus", "iso9660", "jffs2",    "jfs",   "minix",  "msdos",
    "nilfs2",   "ntfs3", "overlay", "ramfs",   "reiserfs", "romfs", "rootfs", "squashfs",
    "tmpfs",    "ubifs", "udf",     "vfat",    "xfs",      "zfs"};
static_assert(std::ranges::is_sorted(kLocalTypes));

bool isLocalType(std::string_view type) { return std::ranges::binary_search(kLocalTypes, type); }

// The kernel allows 100,000 mounts, whose lines have some hundred bytes each.
constexpr size_t kMaxTableSize = size_t{32} << 20;

// The id of the mount that an open file lies on. statx() knows it too, but asks the file system,
// and a dead one would not answer. The kernel writes this file alone.
std::optional<uint64_t> mountIdOf(int fd) {
  constexpr std::string_view kKey = "mnt_id:";
  const auto text = readSmallFile("/proc/self/fdinfo/" + std::to_string(fd), 4096);
  const size_t at = text ? text->find(kKey) : std::string::npos;
  if (at == std::string::npos) return {};
  return std::strtoull(text->c_str() + at + kKey.size(), nullptr, 10);
}

}  // namespace

// A machine with many containers has thousands of mounts, so the table is not read for each
// question. The kernel marks an open table when a mount comes or goes. It counts from the moment
// of opening, so the table is opened before it is read: a change in between is a change.
void MountTable::refresh() {
  pollfd table{watched_.get(), POLLPRI, 0};
  if (watched_.valid() && ::poll(&table, 1, 0) == 0) return;
  watched_ = UniqueFd(::open(path_.c_str(), O_RDONLY | O_CLOEXEC));
  typeOfMount_.clear();
  typeAt_.clear();
  std::istringstream lines(readSmallFile(path_, kMaxTableSize).value_or(""));
  for (std::string line; std::getline(lines, line);) {
    auto mount = mountOf(line);
    if (!mount) continue;
    typeOfMount_[mount->id] = mount->type;
    typeAt_[mount->point] = std::move(mount->type);
  }
}

std::optional<std::string> MountTable::rootFilesystemTypeName() {
  refresh();
  const UniqueFd root(::open("/", O_PATH | O_CLOEXEC));
  if (const auto id = mountIdOf(root.get())) {
    if (const auto mount = typeOfMount_.find(*id); mount != typeOfMount_.end())
      return mount->second;
  }
  const auto topmost = typeAt_.find("/");
  if (topmost == typeAt_.end()) return {};
  return topmost->second;
}

bool MountTable::mayStepOnto(const std::string& path) {
  refresh();
  const auto mount = typeAt_.find(path);
  return mount == typeAt_.end() || isLocalType(mount->second);
}

bool MountTable::isLocal(int fd) {
  refresh();
  const auto id = mountIdOf(fd);
  if (!id) return false;
  const auto mount = typeOfMount_.find(*id);
  return mount != typeOfMount_.end() && isLocalType(mount->second);
}

namespace {

std::string localeForDates() {
  for (const char* variable : {"LC_ALL", "LC_TIME", "LANG"}) {
    const char* value = std::getenv(variable);
    if (value && *value) return value;
  }
  return "C";
}

// ICU knows zones by their names only. TZ may hold a rule instead ("CET-1CEST,M3.5.0,M10.5.0/3"),
// which ICU passes over in silence. The C library knows both, so it tells the offset from UTC at
// this date, and ICU gets a zone that has this offset always.
std::unique_ptr<icu::TimeZone> zoneAt(Date date) {
  const time_t seconds =
      std::chrono::system_clock::to_time_t(std::chrono::floor<std::chrono::seconds>(date));
  tm parts{};
  ::tzset();  // localtime_r() need not look whether the zone has changed
  const bool known = ::localtime_r(&seconds, &parts) != nullptr;
  const auto offset = static_cast<int32_t>(known ? parts.tm_gmtoff * 1000 : 0);
  return std::make_unique<icu::SimpleTimeZone>(offset, icu::UnicodeString("local"));
}

// If ICU cannot read the name, the locale is bogus and formatting would fail. "C" replaces it.
icu::Locale makeLocale(const std::string& name) {
  const icu::Locale locale = icu::Locale::createCanonical(name.c_str());
  return locale.isBogus() ? icu::Locale::createCanonical("C") : locale;
}

}  // namespace

IcuDates::IcuDates() : IcuDates(localeForDates()) {}

std::string IcuDates::format(Date date) {
  const auto milliseconds =
      std::chrono::floor<std::chrono::milliseconds>(date).time_since_epoch().count();
  const std::unique_ptr<icu::DateFormat> formatter(icu::DateFormat::createDateTimeInstance(
      icu::DateFormat::kShort, icu::DateFormat::kMedium, makeLocale(locale_)));
  // ICU without its data cannot make a formatter. The seconds since 1970 are better than no date.
  if (!formatter) return std::to_string(milliseconds / 1000);
  formatter->adoptTimeZone(zoneAt(date).release());
  icu::UnicodeString text;
  formatter->format(static_cast<UDate>(milliseconds), text);
  std::string utf8;
  text.toUTF8String(utf8);
  return utf8;
}

}  // namespace tessel
