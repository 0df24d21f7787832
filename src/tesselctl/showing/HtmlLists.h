// The long lists of the report page: pairs, unknown values, durations.
//
// Each begins with its greatest entries. All others wait behind a disclosure, where a script of the
// page adds a filter and lets people sort. Stateless.

#pragma once

#include "tesselctl/judging/Tally.h"
#include "tesselctl/showing/Html.h"

namespace tessel::ctl {

// Each pair of subsystem and category with its verdicts. A run admits 4,096.
Html pairSection(const Tally& tally, Names& names);

// Whether a page shows recorded values, or is to be passed on to people who must not see them.
enum class RecordedValues { shown, leftOut };

// The text values for which the whitelist held trace points back, and by which trace points they
// were recorded. Without values: only how many values a trace point had. Empty if there is none.
Html missSection(const Tally& tally, RecordedValues values, Names& names);

// How long trace points took, and how fast animations ran. Empty if none had a duration.
Html durationSection(const Tally& tally, Names& names);

}  // namespace tessel::ctl
