// ReporterStatus: the state of the reporter on this machine: tasking, last run with its books,
// marker, spool and journal.
//
// A plain value. It is gathered once and does not change the machine. Any thread.

#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "linux/Findings.h"
#include "linux/LaunchConfiguration.h"
#include "objects/RunRecord.h"
#include "platform/Error.h"
#include "tesselctl/judging/Tasking.h"
#include "tesselctl/reading/SpoolReader.h"

namespace tessel::ctl {

// The unit shows its runs a directory of their own as /var/tmp, where a run keeps its marker. So a
// run under the unit and a run by hand do not see each other's marker.
enum class MarkerOf { unit, runByHand };
// Names for JSON: "unit", "by_hand".
std::string_view markerOfName(MarkerOf kind);

// The file that a run leaves while it reports, at one of its two places.
struct Marker {
  enum class State { absent, present, cannotBeSeen };

  MarkerOf of = MarkerOf::runByHand;
  std::string path;  // of the file, there or not
  State state = State::absent;
  std::string owner;  // if present
  Date since{};       // if present

  bool present() const { return state == State::present; }
};
// Names for JSON: "absent", "present", "cannot_be_seen".
std::string_view markerStateName(Marker::State state);

struct JournalFacts {
  std::optional<Date> oldest;            // entry; absent where the store has none
  std::optional<PlatformError> failure;  // absent where it can be read
};

struct ReporterStatus {
  Date now{};
  Tasking tasking;
  std::string taskingWords;
  std::optional<std::string> deferral;  // why one is wanted
  // The unit's first, if this machine has its directory; then that of a run by hand.
  std::vector<Marker> markers;
  std::optional<RunRecord> run;
  std::vector<PlatformError> refusedFiles;  // of the state directory, each with the reason
  // The begin of the last run that came to its end and was not deferred. The scheduler notes it.
  std::optional<Date> lastBegin;
  SpoolReader::State spoolState = SpoolReader::State::absent;
  std::string spoolFailure;
  SpoolContents spool;
  std::optional<std::string> store;  // absent: the machine's own journal
  JournalFacts journal;

  // What is wrong and what is worth knowing, in the order of the codes: problems first.
  std::vector<Finding> findings;
  std::vector<FindingCode> checked;  // the problems that were looked for

  // Whether the last run sent anything: only then are there sums that must balance.
  bool hasBooks() const { return run && run->hasBooks(); }
  bool good() const { return findings.empty() || !isProblem(findings.front().code); }
  // Whether the journal reaches back as far as a run looks.
  bool keepsADay() const {
    return journal.oldest && *journal.oldest <= now - std::chrono::hours{24};
  }
  // Whether a later run than the recorded one came to its end. It was not tasked, or its record
  // could not be written. A run that dies leaves no note, so it does not show here.
  bool runWithoutRecord() const { return lastBegin && (!run || *lastBegin > run->end); }
};

// Fills `findings` and `checked` from the facts.
void judge(ReporterStatus& status);

// Reads all facts and judges them. A fact that cannot be read is absent; its reason is given if
// there is a place.
ReporterStatus gatherStatus(const LaunchConfiguration& launch, Date now);

}  // namespace tessel::ctl
