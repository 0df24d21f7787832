// Time zones by the C library.
//
// C++20 has a zone database, but the library of Debian 12 does not implement it. A parser of the
// database of our own would be 200 lines beside one that each machine has already.

#include "tesselctl/reading/TimeZone.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <fstream>

namespace tessel::ctl {

namespace {

using std::chrono::seconds;

// The clocks of one place change weeks apart. So the offsets a day before and a day after are the
// only two that can hold at a wall time. No offset is as long as a day.
constexpr seconds kFarFromChange = std::chrono::hours{24};

// While it lives, local time is that of another zone.
class OtherZone {
 public:
  // An empty name leaves the zone as it is.
  explicit OtherZone(const std::string& name) : switched_(!name.empty()) {
    if (!switched_) return;
    if (const char* usual = std::getenv("TZ")) usual_ = usual;
    // The colon makes the rest a name of the database. "EST5" would else be a rule.
    ::setenv("TZ", (":" + name).c_str(), 1);
    ::tzset();
  }
  OtherZone(const OtherZone&) = delete;
  OtherZone& operator=(const OtherZone&) = delete;
  ~OtherZone() {
    if (!switched_) return;
    usual_ ? ::setenv("TZ", usual_->c_str(), 1) : ::unsetenv("TZ");
    ::tzset();
  }

 private:
  const bool switched_;
  std::optional<std::string> usual_;
};

bool isZoneFile(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  std::array<char, 4> magic{};
  return file.read(magic.data(), magic.size()) &&
         std::string_view(magic.data(), magic.size()) == "TZif";
}

// UTC is known without the database, which a small machine may lack.
bool isUtc(std::string_view name) {
  return name == "UTC" || name == "GMT" || name == "utc" || name == "Z";
}

// Whether the text begins like a rule of POSIX: a name of three letters or more, or any name in
// angle brackets, and the distance from UTC. "CET-1CEST,M3.5.0,M10.5.0/3" is one.
bool isRule(std::string_view text) {
  const auto isLetter = [](char c) { return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z'); };
  const size_t name =
      text.starts_with('<')
          ? text.find('>') + 1
          : static_cast<size_t>(std::ranges::find_if_not(text, isLetter) - text.begin());
  if (name < 3) return false;
  text.remove_prefix(name);
  if (text.starts_with('+') || text.starts_with('-')) text.remove_prefix(1);
  return !text.empty() && text.front() >= '0' && text.front() <= '9';
}

// The C library takes any text for a zone and answers UTC for one that it does not know. So we look
// at the file ourselves.
bool inDatabase(std::string_view name) {
  const auto usable = [](char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '_' ||
           c == '-' || c == '+' || c == '/';
  };
  if (name.empty() || name.front() == '/' || !std::all_of(name.begin(), name.end(), usable))
    return false;
  const char* directory = std::getenv("TZDIR");
  const std::string folder =
      directory != nullptr && *directory != '\0' ? directory : "/usr/share/zoneinfo";
  return isZoneFile(folder + "/" + std::string(name));
}

}  // namespace

TimeZone TimeZone::fixed(seconds fromUtc) {
  TimeZone zone;
  zone.fixed_ = fromUtc;
  return zone;
}

std::optional<TimeZone> TimeZone::named(std::string_view name) {
  if (isUtc(name)) return fixed(seconds{0});
  if (!inDatabase(name)) return {};
  TimeZone zone;
  zone.name_ = name;
  return zone;
}

TimeZone::Offset TimeZone::at(Date date) const {
  if (fixed_) return {*fixed_, offsetText(*fixed_)};
  const OtherZone other(name_);
  const std::time_t whole = std::chrono::floor<seconds>(date).time_since_epoch().count();
  std::tm parts{};
  ::localtime_r(&whole, &parts);
  // Copied at once: the name belongs to the zone, which goes with `other`.
  return {seconds{parts.tm_gmtoff}, parts.tm_zone};
}

std::vector<TimeZone::Reading> TimeZone::readings(WallTime wall) const {
  std::vector<Reading> found;
  const seconds before = at(wall - kFarFromChange).fromUtc;
  const seconds after = at(wall + kFarFromChange).fromUtc;
  for (const seconds fromUtc : {before, after}) {
    const Date date = wall - fromUtc;
    const Offset offset = at(date);
    if (offset.fromUtc == fromUtc && (found.empty() || found.front().date != date))
      found.push_back({date, offset});
  }
  std::ranges::sort(found, {}, &Reading::date);
  return found;
}

Date TimeZone::changeNear(WallTime wall) const {
  Date before = wall - 2 * kFarFromChange;
  Date after = wall + 2 * kFarFromChange;
  const seconds first = at(before).fromUtc;
  while (after - before > seconds{1}) {
    const Date middle = before + std::chrono::floor<seconds>((after - before) / 2);
    (at(middle).fromUtc == first ? before : after) = middle;
  }
  return std::chrono::floor<seconds>(after);
}

// A zone has at most a few names in a year, each for weeks.
bool TimeZone::uses(std::string_view offsetName, Date date) const {
  for (int week = -52; week <= 52; ++week) {
    if (at(date + week * std::chrono::hours{7 * 24}).name == offsetName) return true;
  }
  return false;
}

// An empty $TZ is UTC by the rules of POSIX. A colon before a name of the database means nothing.
std::optional<std::string> replaceUnknownZone() {
  const char* value = std::getenv("TZ");
  std::string_view name = value == nullptr ? "" : value;
  if (name.starts_with(':')) name.remove_prefix(1);
  const bool file = name.starts_with('/') && isZoneFile(std::string(name));
  if (name.empty() || file || isUtc(name) || inDatabase(name) || isRule(name)) return {};
  std::string unknown = value;
  ::setenv("TZ", "UTC0", 1);
  ::tzset();
  return unknown;
}

std::string offsetText(seconds fromUtc) {
  const auto minutes = std::abs(fromUtc.count()) / 60;
  char text[16];
  const int length =
      std::snprintf(text, sizeof text, "%c%02d:%02d", fromUtc.count() < 0 ? '-' : '+',
                    static_cast<int>(minutes / 60), static_cast<int>(minutes % 60));
  return {text, static_cast<size_t>(length)};
}

}  // namespace tessel::ctl
