// DryRun: what a run of the service would make of a trace store, without a run.
//
// The store is read, assembled, judged and counted by the service's own parts; nothing is sent, and
// neither the run marker nor the spool is touched. The downsampling counters begin at zero, as in a
// process that has just started.
//
// Memory is bounded as that of a run is. Threads: one at a time.

#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "journal/JournalStore.h"
#include "tesselctl/reading/TimeArguments.h"
#include "trace/JournalExtractor.h"

namespace tessel::ctl {

class DryRun {
 public:
  // Called with each trace object in the order of delivery; the object and `entry`, where it was
  // recorded, are borrowed. False ends the reading.
  using Visitor = std::function<bool(const TesselObject& object, const EntryHeader& entry)>;
  // Told how far the reading is, from 0 to 1, and how many entries were read; called every few
  // thousand entries.
  using Progress = std::function<void(double part, uint64_t entriesRead)>;

  // An absent store is the machine's own journal.
  explicit DryRun(std::optional<std::string> store, Visitor visitor);

  // Reads what the store holds of the period. The error in words.
  std::optional<PlatformError> read(const Period& period, const Progress& progress);
  // Reads on for as long as the visitor answers true: what is recorded from `start` on, soon after
  // it is. Gives up where the store cannot be opened.
  std::optional<PlatformError> follow(Date start, const std::function<void()>& afterEachLook);

  // What was found so far; the store's part is that of the last reading.
  ExtractionReport report() const { return extractor_.report(storeReport_); }

 private:
  std::optional<PlatformError> readOnce(TimeRange range,
                                        const std::function<void(EntryStream&)>& process);

  const std::optional<std::string> store_;
  const Visitor visitor_;
  JournalExtractor extractor_;
  StoreReport storeReport_;
  bool refused_ = false;
};

}  // namespace tessel::ctl
