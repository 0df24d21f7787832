// Findings: what is wrong with the reporter on this machine, and what is worth knowing.
//
// The log, `tesselctl status` and the report page take their findings from here, so they cannot
// disagree. A run finds what it lost and what it could not do; tesselctl adds what it finds on the
// machine. Stateless; any thread.

#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "objects/RunRecord.h"

namespace tessel {

// In the order in which findings are shown. A cause stands before what follows from it.
enum class FindingCode : uint8_t {
  // Problems. Each concerns the state now, or the last run.
  noAccess,
  taskingUnreadable,
  recordUnwritable,
  markerStuck,
  deferred,
  storeUnreadable,
  storeDamaged,
  spoolDamaged,
  forwarderStuck,
  spoolFilling,
  runFailed,
  bailedOut,
  rowsRefused,
  rowsExpired,
  booksUnbalanced,
  noCompletedRun,
  // Notes. Any user of the machine can cause one, or it is no fault of anybody. If they were
  // problems, any user could make a machine look broken.
  nothingStartsRuns,
  runCutShort,
  lostAtSource,
  droppedByDaemon,
  overShare,
  malformed,
  numbersInNoFile,
  storeBeginsLate,
  spoolSetAside,
};
inline constexpr size_t kFindingCodes = 25;

constexpr bool isProblem(FindingCode code) { return code < FindingCode::nothingStartsRuns; }
// The name for programs, such as "rows_refused". It never changes.
std::string_view findingName(FindingCode code);

struct Finding {
  FindingCode code{};
  std::string words;                   // for people: one line of less than 1 KiB, safe for a log
  Date since{};                        // since when it is so, as far as that is known
  std::string advice;                  // what to do about it: a sentence or two, safe for a log
  std::string command;                 // to paste into a shell; it holds no text of a stranger
  std::optional<FindingCode> because;  // the finding that it follows from, where one is known
};

// A finding with the advice and the command that belong to its code.
Finding finding(FindingCode code, std::string words, Date since);
// `text` as one word of a shell, for commands.
std::string shellWord(std::string_view text);

// What the run itself cost, some of its rows or some of its trace points: one finding for each
// reason. Empty for a run that lost nothing. Any writer of the journal can cause losses of his own
// trace points at will. So all losses of a code are one finding, with the first as an example, and
// the number of findings is bounded whatever the store holds.
std::vector<Finding> findingsOf(const RunRecord& record);

// Writes each finding of the run to the platform's log, as a warning.
void logFindings(const RunRecord& record);

}  // namespace tessel
