// Distances in time, periods, and dates in words.

#include "tesselctl/reading/TimeArguments.h"

#include <array>
#include <charconv>
#include <cstdio>
#include <ctime>

#include "platform/Text.h"
#include "tesselctl/reading/Scanner.h"
#include "tesselctl/reading/TimeZone.h"

namespace tessel::ctl {

namespace {

using std::chrono::microseconds;
using std::chrono::seconds;

constexpr microseconds kDay = std::chrono::hours{24};
// A thousand years. Any date minus that is far within what 64 bits of microseconds hold, so no sum
// below can overflow.
constexpr microseconds kLongest = std::chrono::hours{24 * 365'000};

// As `journalctl -o short-unix` prints a time. Fewer digits would be a mistyped date.
bool looksLikeEpoch(std::string_view text) {
  return text.find_first_not_of("0123456789") == std::string_view::npos ? text.size() == 10
                                                                        : text.find('.') == 10;
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
  // No month and no year: their lengths differ, and nobody can see which one a period would have.
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

// We set no locale, so strftime() writes digits and the names of zones alike on each machine.
std::string formatted(Date date, const char* format) {
  const std::time_t whole = std::chrono::floor<seconds>(date).time_since_epoch().count();
  std::tm parts{};
  localtime_r(&whole, &parts);
  char text[64];
  return {text, std::strftime(text, sizeof text, format, &parts)};
}

// " CEST" where clocks show the time of `date` twice, else nothing.
std::string zoneIfTwice(Date date) {
  const TimeZone local = TimeZone::local();
  return local.readings(local.wallTime(date)).size() > 1 ? formatted(date, " %Z") : "";
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

DateResult parseDate(std::string_view text, Date now) {
  const auto result = [](std::optional<Date> date) {
    return date ? DateResult{date, {}} : DateResult{{}, std::string(kNoDate)};
  };
  if (text == "now") return result(now);
  if (text.starts_with('@')) return result(parseEpoch(text.substr(1)));
  if (looksLikeEpoch(text)) return result(parseEpoch(text));
  // A bare "24h" is no date: with --until it could mean before now or after it.
  const bool ago = eatSuffix(text, " ago");
  if (ago || text.starts_with('-')) {
    if (!ago) text.remove_prefix(1);
    const auto distance = parseDuration(text);
    return result(distance ? std::optional(now - *distance) : std::nullopt);
  }
  return parseCalendar(text, now);
}

std::string dateText(Date date) { return formatted(date, "%Y-%m-%d %H:%M:%S") + zoneIfTwice(date); }
std::string timeOfDayText(Date date) { return formatted(date, "%H:%M:%S") + zoneIfTwice(date); }
std::string zonedText(Date date) { return formatted(date, "%Y-%m-%d %H:%M:%S %Z"); }

std::string periodText(const Period& period) {
  const bool oneZone = formatted(period.start, "%Z") == formatted(period.end, "%Z");
  return (oneZone ? formatted(period.start, "%Y-%m-%d %H:%M:%S") : zonedText(period.start)) +
         " to " + zonedText(period.end);
}

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
  Period period{now - kDay, now};
  if (arguments.until) {
    const auto until = parseDate(*arguments.until, now);
    if (!until.date) return wrong("--until", *arguments.until, until.error);
    // Whoever gives an end alone wants the day before it, as without any option he gets the day
    // before now.
    period = {*until.date - kDay, *until.date};
  }
  if (arguments.last) {
    const auto last = parseDuration(*arguments.last);
    if (!last)
      return wrong("--last", *arguments.last,
                   "is no duration; durations look like 30m, 24h, 7d or 1h30m");
    period.start = period.end - *last;
  }
  if (arguments.since) {
    const auto since = parseDate(*arguments.since, now);
    if (!since.date) return wrong("--since", *arguments.since, since.error);
    if (arguments.last) return wrong("--since", *arguments.since, "cannot be combined with --last");
    period.start = *since.date;
  }
  if (period.start >= period.end) {
    return wrong(arguments.since ? "--since" : "--until",
                 arguments.since ? *arguments.since : arguments.until.value_or(""),
                 "leaves an empty period: " + periodText(period));
  }
  return {period, {}};
}

}  // namespace tessel::ctl
