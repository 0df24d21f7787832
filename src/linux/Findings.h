// RunWarnings: what a finished run lost, and what it could not do.
//
// The log and `tesselctl status` take their words from here, so they cannot disagree. Stateless;
// any thread.

#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "objects/RunRecord.h"

namespace tessel {

struct RunWarning {
  std::string_view code;  // for programs, such as "rows_refused"; it never changes
  std::string text;       // for people: one line of less than 1 KiB, safe for a log
};

// One warning for each reason that cost the run itself, some of its rows or some of its trace
// points. Empty for a run that lost nothing. Any writer of the journal can cause losses of his own
// trace points at will. So all losses of a code are one warning, with the first as an example, and
// the number of warnings is bounded whatever the store holds.
std::vector<RunWarning> runWarnings(const RunRecord& record);

// Writes each warning of the run to the platform's log.
void logRunWarnings(const RunRecord& record);

}  // namespace tessel
