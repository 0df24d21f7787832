// Parsing and writing dates.
//
// The parser is written by hand. The C library's follows the locale and takes "2026-02-30" for a
// day in March: a mistyped period would be answered with the figures of another one. Here a text is
// a date from its first to its last character, or it is none.

#include "tesselctl/reading/TimeArguments.h"

#include <array>
#include <charconv>
#include <cstdio>
#include <ctime>

#include "platform/Text.h"

namespace tessel::ctl {

namespace {

using std::chrono::microseconds;
using std::chrono::seconds;

constexpr microseconds kDay = std::chrono::hours{24};
// A thousand years. Any date minus that is far within what 64 bits of microseconds hold, so no sum
// below can overflow.
constexpr microseconds kLongest = std::chrono::hours{24 * 365'000};

// Reads what it is asked for from the front of a text.
class Scanner {
 public:
  explicit Scanner(std::string_view text) : rest_(text) {}

  bool done() const { return rest_.empty(); }
  char peek() const { return rest_.empty() ? '\0' : rest_.front(); }
  bool skip(char wanted) {
    if (peek() != wanted) return false;
    rest_.remove_prefix(1);
    return true;
  }
  void skipSpaces() {
    while (skip(' ')) {
    }
  }
  // A decimal number of `fewest` to `most` digits. Nobody asks for more than 12 digits, which
  // always fit 64 bits.
  std::optional<int64_t> number(size_t fewest, size_t most) {
    size_t digits = 0;
    while (digits < rest_.size() && digits < most && isDigit(rest_[digits])) ++digits;
    int64_t value = 0;
    if (digits < fewest ||
        std::from_chars(rest_.data(), rest_.data() + digits, value).ec != std::errc())
      return {};
    rest_.remove_prefix(digits);
    return value;
  }
  // The part of a second behind a point. Digits beyond microseconds are read and dropped, since
  // other tools print nanoseconds.
  std::optional<microseconds> fraction() {
    microseconds value{0};
    microseconds unit{100'000};
    if (!isDigit(peek())) return {};
    for (; isDigit(peek()); rest_.remove_prefix(1), unit /= 10) value += unit * (peek() - '0');
    return value;
  }
  std::string_view word() {
    size_t length = 0;
    while (length < rest_.size() && rest_[length] >= 'a' && rest_[length] <= 'z') ++length;
    const std::string_view found = rest_.substr(0, length);
    rest_.remove_prefix(length);
    return found;
  }

 private:
  static bool isDigit(char character) { return character >= '0' && character <= '9'; }

  std::string_view rest_;
};

struct CalendarDate {
  std::tm parts{};
  microseconds fraction{0};
};

std::tm localParts(Date date) {
  const std::time_t whole = std::chrono::floor<seconds>(date).time_since_epoch().count();
  std::tm parts{};
  localtime_r(&whole, &parts);
  return parts;
}

// The day is moved in the calendar and not by 24 hours: a day has 23 or 25 hours when the clocks
// change. fromLocal() takes a day 0 as the last of the month before.
std::tm midnight(std::tm parts, int dayOffset) {
  parts.tm_hour = parts.tm_min = parts.tm_sec = 0;
  parts.tm_mday += dayOffset;
  return parts;
}

// The parts may come from `now`, in the other half of the year, with its flag for summer time. The
// value -1 lets the C library ask the time zone instead.
Date fromLocal(std::tm parts) {
  parts.tm_isdst = -1;
  return Date{seconds{std::mktime(&parts)}};
}

bool readDay(Scanner& scanner, std::tm& parts) {
  const auto year = scanner.number(4, 4);
  if (!year || !scanner.skip('-')) return false;
  const auto month = scanner.number(2, 2);
  if (!month || !scanner.skip('-')) return false;
  const auto day = scanner.number(2, 2);
  if (!day) return false;
  const std::chrono::year_month_day date{std::chrono::year{static_cast<int>(*year)},
                                         std::chrono::month{static_cast<unsigned>(*month)},
                                         std::chrono::day{static_cast<unsigned>(*day)}};
  if (!date.ok()) return false;
  parts = {};
  parts.tm_year = static_cast<int>(*year) - 1900;
  parts.tm_mon = static_cast<int>(*month) - 1;
  parts.tm_mday = static_cast<int>(*day);
  return true;
}

bool readTime(Scanner& scanner, CalendarDate& date) {
  const auto hour = scanner.number(2, 2);
  if (!hour || *hour > 23 || !scanner.skip(':')) return false;
  const auto minute = scanner.number(2, 2);
  if (!minute || *minute > 59) return false;
  date.parts.tm_hour = static_cast<int>(*hour);
  date.parts.tm_min = static_cast<int>(*minute);
  if (!scanner.skip(':')) return true;
  // The system's clock never shows a second 60, so a text that does is a mistake.
  const auto second = scanner.number(2, 2);
  if (!second || *second > 59) return false;
  date.parts.tm_sec = static_cast<int>(*second);
  if (!scanner.skip('.')) return true;
  const auto fraction = scanner.fraction();
  date.fraction = fraction.value_or(microseconds{0});
  return fraction.has_value();
}

// "Z", "+01:00" or "+0100": the offset from UTC. No zone is farther ahead than 14 hours.
std::optional<seconds> readZone(Scanner& scanner) {
  if (scanner.skip('Z')) return seconds{0};
  const int sign = scanner.peek() == '-' ? -1 : 1;
  if (!scanner.skip('+') && !scanner.skip('-')) return {};
  const auto hour = scanner.number(2, 2);
  scanner.skip(':');
  const auto minute = scanner.number(2, 2);
  if (!hour || !minute || *hour > 14 || *minute > 59) return {};
  return sign * (std::chrono::hours{*hour} + std::chrono::minutes{*minute});
}

std::optional<Date> parseCalendar(std::string_view text, Date now) {
  CalendarDate date;
  Scanner scanner(text);
  // A year has four digits, so a colon behind two means a time of today.
  if (text.size() > 2 && text[2] == ':') {
    date.parts = midnight(localParts(now), 0);
    if (!readTime(scanner, date) || !scanner.done()) return {};
    return fromLocal(date.parts) + date.fraction;
  }
  if (!readDay(scanner, date.parts)) return {};
  if (!scanner.done() && ((!scanner.skip('T') && !scanner.skip(' ')) || !readTime(scanner, date)))
    return {};
  if (scanner.done()) return fromLocal(date.parts) + date.fraction;
  const auto zone = readZone(scanner);
  if (!zone || !scanner.done()) return {};
  return Date{seconds{timegm(&date.parts)}} - *zone + date.fraction;
}

std::optional<Date> parseEpoch(std::string_view text) {
  Scanner scanner(text);
  const auto whole = scanner.number(1, 12);
  if (!whole) return {};
  const Date date{seconds{*whole}};
  if (scanner.done()) return date;
  if (!scanner.skip('.')) return {};
  const auto fraction = scanner.fraction();
  if (!fraction || !scanner.done()) return {};
  return date + *fraction;
}

std::optional<microseconds> unitNamed(std::string_view word) {
  struct Unit {
    microseconds length;
    std::array<std::string_view, 5> names;
  };
  static constexpr Unit kUnits[] = {
      {seconds{1}, {"s", "sec", "secs", "second", "seconds"}},
      {std::chrono::minutes{1}, {"m", "min", "mins", "minute", "minutes"}},
      {std::chrono::hours{1}, {"h", "hr", "hrs", "hour", "hours"}},
      {kDay, {"d", "day", "days", "day", "days"}},
      {7 * kDay, {"w", "week", "weeks", "week", "weeks"}},
  };
  for (const Unit& unit : kUnits) {
    for (const std::string_view name : unit.names) {
      if (word == name) return unit.length;
    }
  }
  return {};
}

// Takes `suffix` off the end of `text`; false if it is not there.
bool eatSuffix(std::string_view& text, std::string_view suffix) {
  if (!text.ends_with(suffix)) return false;
  text.remove_suffix(suffix.size());
  return true;
}

PeriodResult wrong(std::string_view argument, std::string_view value, std::string_view reason) {
  std::string error(argument);
  error.append(": '").append(plainText(value, "\\x0a")).append("' ").append(reason);
  return {{}, error};
}

std::string formatted(Date date, const char* format) {
  const std::tm parts = localParts(date);
  char text[64];
  return {text, std::strftime(text, sizeof text, format, &parts)};
}

}  // namespace

// "999999999999w" would overflow and give a wrong duration. So we check each part before we
// multiply it, and the sum after each part.
std::optional<microseconds> parseDuration(std::string_view text) {
  Scanner scanner(text);
  microseconds total{0};
  do {
    scanner.skipSpaces();
    const auto count = scanner.number(1, 12);
    scanner.skipSpaces();
    const auto unit = count ? unitNamed(scanner.word()) : std::nullopt;
    if (!unit || *count > kLongest / *unit) return {};
    total += *count * *unit;
    scanner.skipSpaces();
    if (total > kLongest) return {};
  } while (!scanner.done());
  return total.count() > 0 ? std::optional(total) : std::nullopt;
}

std::optional<Date> parseDate(std::string_view text, Date now) {
  if (text == "now") return now;
  if (text == "today") return fromLocal(midnight(localParts(now), 0));
  if (text == "yesterday") return fromLocal(midnight(localParts(now), -1));
  if (text.starts_with('@')) return parseEpoch(text.substr(1));
  const bool ago = eatSuffix(text, " ago");
  if (ago || text.starts_with('-')) {
    if (!ago) text.remove_prefix(1);
    const auto distance = parseDuration(text);
    return distance ? std::optional(now - *distance) : std::nullopt;
  }
  return parseCalendar(text, now);
}

std::string dateText(Date date) { return formatted(date, "%Y-%m-%d %H:%M:%S"); }
std::string timeOfDayText(Date date) { return formatted(date, "%H:%M:%S"); }

// With the distance from UTC two stamps of the hour that repeats when summer time ends are told
// apart.
std::string stampText(Date date) {
  const auto part = date - std::chrono::floor<seconds>(date);
  std::string digits = std::to_string(part.count());
  digits.insert(0, 6 - digits.size(), '0');
  std::string zone = formatted(date, "%z");  // +0100
  if (zone.size() == 5) zone.insert(3, ":");
  return formatted(date, "%Y-%m-%dT%H:%M:%S.") + digits + zone;
}

// One or two whole units are enough to tell how long ago a run was. Up to two days are given in
// hours: the service runs daily, so "1 day" would not say whether a run is overdue.
std::string durationText(microseconds duration) {
  const auto whole = std::chrono::floor<seconds>(duration).count();
  if (whole < 60) return std::to_string(whole) + " s";
  if (whole < 3600) return std::to_string(whole / 60) + " min";
  const auto minutes = whole / 60 % 60;
  if (whole < 172'800) {
    return std::to_string(whole / 3600) + " h" +
           (minutes == 0 ? "" : " " + std::to_string(minutes) + " min");
  }
  return std::to_string(whole / 86'400) + " days";
}

// --until sets the end and, alone, the day before it; --last sets the length back from the end;
// --since sets the start. So --since and --last contradict each other, all else combines.
PeriodResult periodOf(const PeriodArguments& arguments, Date now) {
  static constexpr char kDates[] =
      "is no date; dates look like 2026-11-22, '2026-11-22 21:45', 21:45, yesterday, -24h or '2 "
      "hours ago'";
  Period period{now - kDay, now};
  if (!arguments.until.empty()) {
    const auto until = parseDate(arguments.until, now);
    if (!until) return wrong("--until", arguments.until, kDates);
    period = {*until - kDay, *until};
  }
  if (!arguments.last.empty()) {
    const auto last = parseDuration(arguments.last);
    if (!last)
      return wrong("--last", arguments.last, "is no duration; durations look like 30m, 24h or 7d");
    period.start = period.end - *last;
  }
  if (!arguments.since.empty()) {
    const auto since = parseDate(arguments.since, now);
    if (!since) return wrong("--since", arguments.since, kDates);
    if (!arguments.last.empty())
      return wrong("--since", arguments.since, "cannot be combined with --last");
    period.start = *since;
  }
  if (period.start >= period.end) {
    return wrong(
        arguments.since.empty() ? "--until" : "--since",
        arguments.since.empty() ? arguments.until : arguments.since,
        "leaves an empty period: " + dateText(period.start) + " to " + dateText(period.end));
  }
  return {period, {}};
}

}  // namespace tessel::ctl
