// ReporterStatus: the state of the reporter on this machine: tasking, last run with its books,
// marker, spool and journal.
//
// A plain value. It is gathered once and does not change the machine. Any thread.

#pragma once

#include <chrono>
#include <optional>
#include <string>

#include "linux/LaunchConfiguration.h"
#include "objects/RunRecord.h"
#include "platform/Error.h"
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
  std::optional<Date> oldest;            // entry; absent where the store has none
  std::optional<PlatformError> failure;  // absent where it can be read
};

struct ReporterStatus {
  Date now{};
  Tasking tasking;
  std::string taskingWords;
  std::optional<std::string> deferral;  // why one is wanted
  Marker marker;
  std::optional<RunRecord> run;
  // The begin of the last run that came to its end and was not deferred. The scheduler notes it.
  std::optional<Date> lastBegin;
  SpoolReader::State spoolState = SpoolReader::State::absent;
  std::string spoolFailure;
  SpoolContents spool;
  std::optional<std::string> store;  // absent: the machine's own journal
  JournalFacts journal;

  // Whether the last run sent anything: only then are there sums that must balance.
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
  // Whether a later run than the recorded one came to its end. It was not tasked, or its record
  // could not be written. A run that dies leaves no note, so it does not show here.
  bool runWithoutRecord() const { return lastBegin && (!run || *lastBegin > run->end); }
};

// Reads all facts. A fact that cannot be read is absent; its reason is given if there is a place.
ReporterStatus gatherStatus(const LaunchConfiguration& launch, Date now);

}  // namespace tessel::ctl
