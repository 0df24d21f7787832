// ReporterStatus: what this machine says of its reporter, as `tesselctl status` shows it: the
// tasking, the last run with its books, the marker, the spool and the journal.
//
// A value, gathered once; nothing in it is written back. Threads: any.

#pragma once

#include <chrono>
#include <optional>
#include <string>

#include "linux/LaunchConfiguration.h"
#include "objects/RunRecord.h"
#include "tesselctl/judging/Tasking.h"
#include "tesselctl/reading/SpoolReader.h"

namespace tessel::ctl {

// The file that a run leaves while it reports.
struct Marker {
  bool present = false;
  std::string owner;
  Date since{};
};

struct JournalFacts {
  std::optional<Date> oldest;
  std::string failure;  // why it cannot be read; empty where it can
};

struct ReporterStatus {
  Date now{};
  Tasking tasking;
  std::string taskingWords;
  std::optional<std::string> deferral;  // why one is wanted
  Marker marker;
  std::optional<RunRecord> run;
  std::optional<Date> lastBegin;  // of the last run, recorded or not
  SpoolReader::State spoolState = SpoolReader::State::absent;
  std::string spoolFailure;
  SpoolContents spool;
  std::optional<std::string> store;  // absent: the machine's own journal
  JournalFacts journal;

  // A run that got as far as sending anything.
  bool hasBooks() const { return run && run->hasBooks(); }
  bool good() const {
    if (run && run->outcome == RunOutcome::failed) return false;
    if (hasBooks() && (!run->objectsBalance() || !run->rowsBalance())) return false;
    return spoolState != SpoolReader::State::damaged;
  }
  // Whether the journal reaches back as far as a run looks.
  bool keepsADay() const {
    return journal.oldest && *journal.oldest <= now - std::chrono::hours{24};
  }
  // The scheduler knows of a run that left no record.
  bool runWithoutRecord() const { return lastBegin && (!run || *lastBegin > run->end); }
};

// Reads all of it; what cannot be read stands there as absent, with its reason.
ReporterStatus gatherStatus(const LaunchConfiguration& launch);

}  // namespace tessel::ctl
