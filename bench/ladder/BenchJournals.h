// Journals to measure on: a machine's day of trace points among other log lines, written by
// systemd-journal-remote in the layout that the journal daemon uses.

#pragma once

#include <cstdint>
#include <string>

namespace tessel::bench {

struct JournalSpec {
  std::string name;         // of the directory
  uint64_t entries = 0;     // in all files together
  unsigned files = 1;       // one after another in time
  unsigned onePointIn = 2;  // one entry in so many is a trace point
  // Instead of that: three entries in four are trace points, half of these begins and ends with ids
  // of their own, and an end comes so many begins after its begin. 0: as above.
  unsigned openIntervals = 0;
  bool fewFields = false;  // with `openIntervals`: 9 fields an entry and not 21
};

// Makes the journals of `spec` under `directory`, unless they are there already; answers where.
std::string makeJournals(const std::string& directory, const JournalSpec& spec);

}  // namespace tessel::bench
