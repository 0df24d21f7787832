// Parsing dates of the calendar.
//
// The parser is written by hand. The C library's follows the locale and takes "2026-02-30" for a
// day in March: a mistyped period would be answered with the figures of another one. Here a text is
// a date from its first to its last character, or it is none.

#include "tesselctl/reading/CalendarDate.h"

#include <array>
#include <ctime>
#include <vector>

#include "platform/Text.h"
#include "tesselctl/reading/Scanner.h"
#include "tesselctl/reading/TimeZone.h"

namespace tessel::ctl {

namespace {

using std::chrono::microseconds;
using std::chrono::seconds;
using std::chrono::sys_days;

// A day as a text names it. It means a day only once the zone is known, which stands behind it.
struct NamedDay {
  std::optional<std::chrono::year_month_day> date;
  std::optional<std::chrono::month_day> ofAnyYear;
  std::optional<int> fromToday;  // days
  std::optional<std::chrono::weekday> weekday;
};

// The place of `word` among `names`, which it may also give by its first three letters.
template <size_t N>
std::optional<unsigned> placeOf(std::string_view word,
                                const std::array<std::string_view, N>& names) {
  for (unsigned i = 0; i < N; ++i) {
    if (word == names[i] || word == names[i].substr(0, 3)) return i;
  }
  return {};
}

std::optional<std::chrono::weekday> weekdayNamed(std::string_view word) {
  static constexpr std::array<std::string_view, 7> kNames = {
      "sunday", "monday", "tuesday", "wednesday", "thursday", "friday", "saturday"};
  const auto place = placeOf(word, kNames);
  return place ? std::optional(std::chrono::weekday{*place}) : std::nullopt;
}

std::optional<std::chrono::month> monthNamed(std::string_view word) {
  static constexpr std::array<std::string_view, 12> kNames = {
      "january", "february", "march",     "april",   "may",      "june",
      "july",    "august",   "september", "october", "november", "december"};
  const auto place = placeOf(word, kNames);
  return place ? std::optional(std::chrono::month{*place + 1}) : std::nullopt;
}

bool readDate(Scanner& scanner, NamedDay& day) {
  const auto year = scanner.number(4, 4);
  if (!year || !scanner.skip('-')) return false;
  const auto month = scanner.number(2, 2);
  if (!month || !scanner.skip('-')) return false;
  const auto ofMonth = scanner.number(2, 2);
  if (!ofMonth) return false;
  day.date = {std::chrono::year{static_cast<int>(*year)},
              std::chrono::month{static_cast<unsigned>(*month)},
              std::chrono::day{static_cast<unsigned>(*ofMonth)}};
  return day.date->ok();
}

bool readDayOfMonth(Scanner& scanner, std::chrono::month month, NamedDay& day) {
  scanner.skipSpaces();
  const auto ofMonth = scanner.number(1, 2);
  if (!ofMonth) return false;
  day.ofAnyYear = {month, std::chrono::day{static_cast<unsigned>(*ofMonth)}};
  return day.ofAnyYear->ok();
}

// A year has four digits, so a colon behind two begins a time of day.
bool beginsTime(const Scanner& scanner) {
  return scanner.rest().size() > 2 && scanner.rest()[2] == ':';
}

// Reads "2026-11-22", "Nov 22", "monday", "Sun 2026-11-22", "Sun Nov 22", "today" or nothing, which
// is today if a time of day follows.
bool readDay(Scanner& scanner, NamedDay& day) {
  if (beginsTime(scanner)) {
    day.fromToday = 0;
    return true;
  }
  std::string word = scanner.word();
  if (word.empty()) return readDate(scanner, day);
  for (const auto& [name, days] :
       {std::pair{"yesterday", -1}, std::pair{"today", 0}, std::pair{"tomorrow", 1}}) {
    if (word != name) continue;
    day.fromToday = days;
    return true;
  }
  day.weekday = weekdayNamed(word);
  if (day.weekday) {
    Scanner behind = scanner;
    behind.skip(',');
    behind.skipSpaces();
    Scanner date = behind;
    if (!beginsTime(behind) && readDate(date, day)) {
      scanner = date;
      return true;
    }
    day.date.reset();
    date = behind;
    word = date.word();
    if (!monthNamed(word)) return true;
    scanner = date;
  }
  const auto month = monthNamed(word);
  return month && readDayOfMonth(scanner, *month, day);
}

// Reads "21:45", "21:45:30" or "21:45:30.5".
std::optional<microseconds> readTime(Scanner& scanner) {
  const auto hour = scanner.number(2, 2);
  if (!hour || *hour > 23 || !scanner.skip(':')) return {};
  const auto minute = scanner.number(2, 2);
  if (!minute || *minute > 59) return {};
  microseconds time = std::chrono::hours{*hour} + std::chrono::minutes{*minute};
  if (!scanner.skip(':')) return time;
  // The system's clock never shows a second 60, so a text that does is a mistake.
  const auto second = scanner.number(2, 2);
  if (!second || *second > 59) return {};
  time += seconds{*second};
  if (!scanner.skip('.')) return time;
  const auto fraction = scanner.fraction();
  if (!fraction) return {};
  return time + *fraction;
}

// "Z", "+01", "+01:00" or "+0100". No zone is farther ahead than 14 hours.
std::optional<seconds> offsetIn(std::string_view text) {
  if (text == "Z") return seconds{0};
  Scanner scanner(text);
  const int sign = scanner.peek() == '-' ? -1 : 1;
  if (!scanner.skip('+') && !scanner.skip('-')) return {};
  const auto hour = scanner.number(2, 2);
  const bool colon = scanner.skip(':');
  const auto minute = scanner.done() && !colon ? 0 : scanner.number(2, 2);
  if (!hour || !minute || !scanner.done() || *hour > 14 || *minute > 59) return {};
  return sign * (std::chrono::hours{*hour} + std::chrono::minutes{*minute});
}

// A zone as a text names it. "CET" is no zone of its own where local clocks use that name: it then
// says which of their readings is meant.
struct NamedZone {
  TimeZone zone = TimeZone::local();
  std::string offsetName;  // may be empty
};

// The local reading comes before the database: "IST" in India is the zone of the clocks there, and
// not that of Israel, which another table may hold.
std::optional<NamedZone> zoneNamed(std::string_view text, Date now) {
  if (text.empty()) return NamedZone{};
  if (const auto offset = offsetIn(text)) return NamedZone{TimeZone::fixed(*offset), {}};
  if (TimeZone::local().uses(text, now)) return NamedZone{TimeZone::local(), std::string(text)};
  const auto zone = TimeZone::named(text);
  return zone ? std::optional(NamedZone{*zone, {}}) : std::nullopt;
}

std::string numeric(WallTime wall, const char* format) {
  const std::time_t whole = std::chrono::floor<seconds>(wall).time_since_epoch().count();
  std::tm parts{};
  gmtime_r(&whole, &parts);
  char text[64];
  return {text, std::strftime(text, sizeof text, format, &parts)};
}
// A text that means one instant everywhere.
std::string exact(WallTime wall, seconds fromUtc) {
  return "'" + numeric(wall, "%Y-%m-%d %H:%M:%S") + offsetText(fromUtc) + "'";
}

std::string twice(WallTime wall, const std::vector<TimeZone::Reading>& readings) {
  std::string error = "comes twice, because clocks go back: write";
  for (const auto& reading : readings) {
    error += (&reading == &readings.front() ? " " : " or ") + exact(wall, reading.offset.fromUtc) +
             " (" + reading.offset.name + ")";
  }
  return error;
}

// Both corrections are offered. Which one is meant depends on whether the time was taken from a
// clock before the change or counted on from it.
std::string skipped(WallTime wall, const TimeZone& zone) {
  const Date change = zone.changeNear(std::chrono::floor<seconds>(wall));
  const TimeZone::Offset before = zone.at(change - seconds{1});
  const TimeZone::Offset after = zone.at(change);
  std::string error = "is skipped, because clocks go forward from " +
                      numeric(change + before.fromUtc, "%H:%M:%S ") + before.name + " to " +
                      numeric(change + after.fromUtc, "%H:%M:%S ") + after.name + ": write ";
  const auto shown = [&](const TimeZone::Offset& written, const TimeZone::Offset& meant) {
    return exact(wall, written.fromUtc) + " (" +
           numeric(wall - written.fromUtc + meant.fromUtc, "%H:%M:%S ") + meant.name + ")";
  };
  return error + shown(before, after) + " or " + shown(after, before);
}

// The day that is meant, seen from a clock of the zone. A day without a year is the latest that is
// at most a day ahead: the clock of another machine may be a little ahead of ours.
std::optional<sys_days> dayOf(const NamedDay& named, WallTime now) {
  const auto today = std::chrono::floor<std::chrono::days>(now);
  if (named.fromToday) return today + std::chrono::days{*named.fromToday};
  if (named.date) return sys_days{*named.date};
  if (named.ofAnyYear) {
    const int thisYear = int{std::chrono::year_month_day{today}.year()};
    // February 29 may be seven years back: a century that is no leap year lies between two of them.
    for (int year = thisYear + 1; year > thisYear - 8; --year) {
      const auto date = std::chrono::year{year} / *named.ofAnyYear;
      if (date.ok() && sys_days{date} <= today + std::chrono::days{1}) return sys_days{date};
    }
    return {};
  }
  if (!named.weekday) return {};
  return today - (std::chrono::weekday{today} - *named.weekday);
}

DateResult dateAt(WallTime wall, const NamedZone& named) {
  const auto readings = named.zone.readings(wall);
  if (!named.offsetName.empty()) {
    for (const auto& reading : readings) {
      if (reading.offset.name == named.offsetName) return {reading.date, {}};
    }
    if (!readings.empty())
      return {{},
              "is not in " + named.offsetName + ": clocks show " + readings[0].offset.name +
                  " then; write " + exact(wall, readings[0].offset.fromUtc)};
  }
  if (readings.size() == 1) return {readings[0].date, {}};
  return {{}, readings.empty() ? skipped(wall, named.zone) : twice(wall, readings)};
}

// Where clocks change at midnight, a day begins with its first instant, whatever clocks show then.
Date beginOfDay(sys_days day, const TimeZone& zone) {
  const auto readings = zone.readings(day);
  return readings.empty() ? zone.changeNear(day) : readings.front().date;
}

}  // namespace

DateResult parseCalendar(std::string_view text, Date now) {
  const DateResult none{{}, std::string(kNoDate)};
  Scanner scanner(text);
  NamedDay named;
  if (!readDay(scanner, named)) return none;
  std::optional<microseconds> time;
  Scanner behind = scanner;
  if (!behind.skip('T')) behind.skipSpaces();
  if (beginsTime(behind)) {
    time = readTime(behind);
    if (!time) return none;
    scanner = behind;
  }
  // A name must stand apart, a distance from UTC need not: "22:45CET" is a mistyped time,
  // "22:45+01:00" is what programs print.
  const bool apart = scanner.skip(' ');
  const std::string_view zoneText = scanner.rest();
  if (zoneText.empty() ? apart : !apart && !offsetIn(zoneText)) return none;
  const auto zone = zoneNamed(zoneText, now);
  if (!zone && Scanner(zoneText).number(1, 1)) return none;
  if (!zone)
    return {{},
            "names no time zone that is known here: '" + plainText(zoneText, "\\x0a") +
                "'; zones look like Z, +01:00, " + TimeZone::local().at(now).name +
                " or Europe/Berlin"};
  const auto day = dayOf(named, zone->zone.wallTime(now));
  if (!day) return none;
  if (named.weekday && std::chrono::weekday{*day} != *named.weekday)
    return {{}, "is no such day: " + numeric(*day, "%Y-%m-%d is a %A")};
  if (time) return dateAt(*day + *time, *zone);
  return {beginOfDay(*day, zone->zone), {}};
}

}  // namespace tessel::ctl
