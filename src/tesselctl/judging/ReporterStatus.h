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
#include "linux/SystemFacts.h"
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
  // If present:
  std::string owner;
  bool ofService = false;  // made by the service's user
  Date since{};

  bool present() const { return state == State::present; }
};
// Names for JSON: "absent", "present", "cannot_be_seen".
std::string_view markerStateName(Marker::State state);

struct JournalFacts {
  std::optional<Date> oldest;  // entry; absent where the store has none
  // Whether an older entry may stand further on. Only a whole reading of an export file would tell,
  // since its entries may stand in any order.
  bool mayBeOlder = false;
  std::optional<PlatformError> failure;  // absent where it can be read
};

// When the next run begins, and what starts it.
struct NextRun {
  enum class By { nothing, timer, interval, underWay };

  By by = By::nothing;         // nothing: nobody knows what starts it
  std::optional<Date> at;      // absent where nobody knows
  bool timerInactive = false;  // the service manager says so; else it did not answer
};
// Names for JSON: "nothing", "timer", "interval", "under_way".
std::string_view nextRunName(NextRun::By by);

// How the service's user stands to what it must read and write.
struct ServiceAccess {
  std::optional<std::string> taskingRefused;  // why it cannot read the tasking file
  std::optional<std::string> recordRefused;   // why it cannot write the record
  bool taskingKnown = false;                  // whether this user could find out
  bool recordKnown = false;
};

struct ReporterStatus {
  Date now{};
  Boot boot;
  // The variables named TESSEL_... that this process was started with. The units may have others.
  std::vector<std::string> variables;
  std::string stateDirectory;
  bool ofPackage = false;                   // it is the one that the package's unit uses
  std::optional<std::string> stateRefused;  // why this user may not look into it
  Tasking tasking;
  std::string taskingWords;
  std::optional<Date> taskingWritten;  // when the file was written that decides
  ServiceAccess service;
  std::optional<std::string> deferral;  // why one is wanted
  std::optional<Date> deferredSince;    // since when the machine or the defer file wants one
  // The unit's first, if this machine has its directory; then that of a run by hand.
  std::vector<Marker> markers;
  static constexpr size_t kMaxRuns = 32;  // a month of daily runs
  std::vector<RunNote> runs;              // the last ones, oldest first
  std::optional<RunRecord> run;
  std::optional<PlatformError> recordFailure;  // why the record is not used
  std::optional<Date> recordWritten;           // when its file was written
  bool underWay = false;                       // somebody holds the right to run
  std::vector<PlatformError> refusedFiles;     // of the state directory, each with the reason
  // The begin of the last run that came to its end and was not deferred. The scheduler notes it.
  std::optional<Date> lastBegin;
  NextRun nextRun;
  SpoolReader::State spoolState = SpoolReader::State::absent;
  std::string spoolFailure;
  SpoolContents spool;
  uint64_t spoolLimitBytes = 0;
  std::optional<std::string> store;  // absent: the machine's own journal
  JournalFacts journal;
  // What is wrong and what is worth knowing, in the order of the codes: problems first.
  std::vector<Finding> findings;
  std::vector<FindingCode> checked;  // the problems that were looked for

  // Whether the last run reported anything: only then are there sums that must balance.
  bool hasBooks() const { return run && run->hasBooks(); }
  bool good() const { return findings.empty() || !isProblem(findings.front().code); }
  // Whether the journal reaches back as far as a run looks.
  bool keepsADay() const {
    return journal.oldest && *journal.oldest <= now - std::chrono::hours{24};
  }
  // How full the spool is, without rows that were delivered: they give way to new ones. Rounded up,
  // so that a spool with rows in it does not seem to be empty.
  uint64_t spoolPercent() const {
    return spool.bytesOfWaiting == 0 ? 0 : spool.bytesOfWaiting / (spoolLimitBytes / 100 + 1) + 1;
  }
  // Whether the last run had nothing to do: reporting is off, and a run later than the noted ones
  // came to its end.
  bool lastRunWasUntasked() const {
    return !tasking.decision.on() && lastBegin &&
           (runs.empty() || *lastBegin > runs.back().start) && (!run || *lastBegin > run->start);
  }
  // Whether the last run that began has no end, and is not under way.
  bool lastRunDied() const { return !underWay && !runs.empty() && !runs.back().end; }
  // Whether a later run than the noted ones came to its end: it was not tasked, or nothing could be
  // written. A record that was written since that run began says that the run did write.
  bool runWithoutNote() const {
    if (!lastBegin) return false;
    if (recordFailure) return true;
    return (runs.empty() || *lastBegin > runs.back().start) &&
           (!recordWritten || *recordWritten < *lastBegin);
  }
};

// Names for each finding the one that it follows from, where that one was found, too.
void nameCauses(ReporterStatus& status);

// Fills `findings` and `checked` from the facts.
void judge(ReporterStatus& status);

// Reads all facts and judges them. A fact that cannot be read is absent; its reason is given if
// there is a place.
ReporterStatus gatherStatus(const LaunchConfiguration& launch, Date now);

}  // namespace tessel::ctl
