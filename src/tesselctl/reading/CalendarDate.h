// A date of the calendar, as people and journalctl write it: see TimeArguments.h for the forms.

#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/System.h"

namespace tessel::ctl {

struct DateResult {
  std::optional<Date> date;
  std::string error;  // continues "'...'": "is no date; ..."; empty with a date
};

inline constexpr std::string_view kNoDate =
    "is no date; dates look like 2026-11-22, '2026-11-22 21:45', '2026-11-22 21:45 CET', 21:45, "
    "yesterday, monday, -24h or '2 hours ago'";

// The date that `text` names, seen from `now`. A time of day that clocks showed twice or skipped is
// an error that names both readings: we would guess wrong by an hour half of the time.
DateResult parseCalendar(std::string_view text, Date now);

}  // namespace tessel::ctl
