// Dates and durations as they are given on a command line.
//
//   now
//   today  yesterday  tomorrow  monday      a day begins at midnight
//   2026-11-22  'Nov 22'                    without a year: the latest such day, tomorrow at most
//   21:45  21:45:30.5                       today
//   '2026-11-22 21:45'  2026-11-22T21:45  'Sun 2026-11-22 21:45:30'  'monday 21:45'
//   ... with Z, +01:00, +0100, ' CET' or ' Europe/Berlin' behind
//   @1795379995  1795379995.250000          seconds since 1970
//   -24h   24h ago   1h30m ago   2 days ago
//
// Each form in which journalctl prints a date is among them, but for the monotonic one. A date
// without a zone is local time. A duration is a number and s, m, h, d or w, or the words for them;
// several parts add up. No thread may use local time meanwhile: see TimeZone.h.

#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <string_view>

#include "platform/System.h"
#include "tesselctl/reading/CalendarDate.h"

namespace tessel::ctl {

// The date that `text` names, seen from `now`.
DateResult parseDate(std::string_view text, Date now);
// Nothing if `text` is no duration, or one of zero or of more than a thousand years.
std::optional<std::chrono::microseconds> parseDuration(std::string_view text);

// "2026-11-22 21:45:01", local time. In an hour that clocks show twice the zone stands behind it,
// "2026-10-25 02:30:00 CEST", because nothing else tells the two apart.
std::string dateText(Date date);
// "2026-11-22T21:45:01.250000+01:00", local time and its distance from UTC. parseDate() reads it.
std::string stampText(Date date);
// "21:45:01", local time, with the zone as dateText().
std::string timeOfDayText(Date date);
// "2026-11-22 21:45:01 CET", local time.
std::string zonedText(Date date);
// "3 s", "5 min", "2 h 10 min", "4 days".
std::string durationText(std::chrono::microseconds duration);

struct Period {
  Date start;
  Date end;  // not in the period
  std::chrono::microseconds length() const { return end - start; }
};
// "2026-11-22 21:45:01 to 2026-11-23 21:45:01 CET", with two zones where clocks changed between.
std::string periodText(const Period& period);

// The values of --since, --until and --last; absent if the option is not given. An empty value is a
// mistake: a script gave a variable that is not set.
struct PeriodArguments {
  std::optional<std::string> since;
  std::optional<std::string> until;
  std::optional<std::string> last;

  bool given() const { return since || until || last; }
};

struct PeriodResult {
  std::optional<Period> period;
  std::string error;  // names the option and its value, fit for a terminal; empty with a period
};
// The period that the arguments name. Without arguments it is the 24 hours before `now`.
PeriodResult periodOf(const PeriodArguments& arguments, Date now);

}  // namespace tessel::ctl
