// Dates and durations as they are given on a command line.
//
//   now  today  yesterday
//   2026-11-22   2026-11-22 21:45   2026-11-22T21:45:00.5   ... with Z or +01:00 behind
//   21:45  21:45:30        today
//   @1795379995            seconds since 1970
//   -24h   24h ago   1h30m ago   2 days ago
//
// A date without a zone is local time. A duration is a number and s, m, h, d or w, or the words for
// them; several parts add up. Stateless; any thread, as long as none changes the time zone.

#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <string_view>

#include "platform/System.h"

namespace tessel::ctl {

// The date that `text` names, seen from `now`; nothing if it names none.
std::optional<Date> parseDate(std::string_view text, Date now);
// Nothing if `text` is no duration, or one of zero or of more than a thousand years.
std::optional<std::chrono::microseconds> parseDuration(std::string_view text);

// "2026-11-22 21:45:01", local time.
std::string dateText(Date date);
// "2026-11-22T21:45:01.250000+01:00", local time and its distance from UTC. parseDate() reads it.
std::string stampText(Date date);
// "21:45:01", local time.
std::string timeOfDayText(Date date);
// "3 s", "5 min", "2 h 10 min", "4 days".
std::string durationText(std::chrono::microseconds duration);

struct Period {
  Date start;
  Date end;  // not in the period
  std::chrono::microseconds length() const { return end - start; }
};

// The values of --since, --until and --last; empty if the option is not given.
struct PeriodArguments {
  std::string since;
  std::string until;
  std::string last;

  bool given() const { return !since.empty() || !until.empty() || !last.empty(); }
};

struct PeriodResult {
  std::optional<Period> period;
  std::string error;  // names the option and its value, fit for a terminal; empty with a period
};
// The period that the arguments name. Without arguments it is the 24 hours before `now`.
PeriodResult periodOf(const PeriodArguments& arguments, Date now);

}  // namespace tessel::ctl
