// Clocks, os-release, mountinfo and ICU.
//
// In a container every one of these sources may be missing or strange. So no question here fails:
// each has an answer for "unknown".

#include "linux/SystemFacts.h"

#include <unicode/datefmt.h>
#include <unicode/locid.h>
#include <unicode/timezone.h>

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <fstream>
#include <memory>
#include <sstream>
#include <thread>
#include <utility>

#include "os/Files.h"

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

void SystemClock::sleepMicroseconds(uint32_t microseconds) {
  std::this_thread::sleep_for(std::chrono::microseconds{microseconds});
}

bool SystemClock::wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) {
  return semaphore.waitFor(timeout);
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

OsReleaseBuildVariant::OsReleaseBuildVariant(const std::string& path)
    : internal_(osReleaseValue(readSmallFile(path, kMaxOsReleaseSize).value_or(""), "VARIANT_ID") ==
                "internal") {}

bool OsReleaseBuildVariant::hasInternalDiagnostics(std::string_view /*subsystem*/) {
  return internal_;
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

// The file system type in one line, if that line is about "/". A line reads
//   id parent device root MOUNT-POINT options [optional...] - TYPE source options
// The number of optional fields varies, so we skip to the dash.
std::optional<std::string> typeAtRoot(const std::string& line) {
  std::istringstream fields(line);
  std::string field;
  for (int i = 0; i < 5; ++i) fields >> field;
  if (!fields || unescaped(field) != "/") return {};
  while (fields >> field && field != "-") {
  }
  if (!(fields >> field)) return {};
  return unescaped(field);
}

}  // namespace

std::optional<std::string> MountTable::rootFilesystemTypeName() {
  std::ifstream table(path_);
  std::optional<std::string> type;
  for (std::string line; std::getline(table, line);) {
    if (auto found = typeAtRoot(line)) type = std::move(found);
  }
  return type;
}

namespace {

std::string localeForDates() {
  for (const char* variable : {"LC_ALL", "LC_TIME", "LANG"}) {
    const char* value = std::getenv(variable);
    if (value && *value) return value;
  }
  return "C";
}

std::unique_ptr<icu::TimeZone> makeTimeZone(const std::optional<std::string>& name) {
  if (!name) return std::unique_ptr<icu::TimeZone>(icu::TimeZone::detectHostTimeZone());
  return std::unique_ptr<icu::TimeZone>(
      icu::TimeZone::createTimeZone(icu::UnicodeString::fromUTF8(*name)));
}

// If ICU cannot read the name, the locale is bogus and formatting would fail. "C" replaces it.
icu::Locale makeLocale(const std::string& name) {
  const icu::Locale locale = icu::Locale::createCanonical(name.c_str());
  return locale.isBogus() ? icu::Locale::createCanonical("C") : locale;
}

}  // namespace

IcuDates::IcuDates() : IcuDates(localeForDates(), {}) {}

IcuDates::IcuDates(std::string locale, std::optional<std::string> timeZone)
    : locale_(std::move(locale)), timeZone_(std::move(timeZone)) {}

std::string IcuDates::format(Date date) {
  const auto milliseconds =
      std::chrono::floor<std::chrono::milliseconds>(date).time_since_epoch().count();
  const std::unique_ptr<icu::DateFormat> formatter(icu::DateFormat::createDateTimeInstance(
      icu::DateFormat::kShort, icu::DateFormat::kMedium, makeLocale(locale_)));
  // ICU without its data cannot make a formatter. The seconds since 1970 are better than no date.
  if (!formatter) return std::to_string(milliseconds / 1000);
  if (auto zone = makeTimeZone(timeZone_)) formatter->adoptTimeZone(zone.release());
  icu::UnicodeString text;
  formatter->format(static_cast<UDate>(milliseconds), text);
  std::string utf8;
  text.toUTF8String(utf8);
  return utf8;
}

}  // namespace tessel
