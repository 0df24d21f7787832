// DryRun: what a run of the service would make of a trace store, without a run.
//
// The parts of the service read the store and assemble the trace objects. The visitor judges and
// counts them. Nothing is reported. The run marker and the spool stay as they are.
//
// Memory has the bounds of a run. Threads: one at a time.

#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "journal/JournalStore.h"
#include "tesselctl/reading/TimeArguments.h"
#include "trace/JournalExtractor.h"

namespace tessel::ctl {

// The name of the store that is an export stream on standard input, and what users call it.
inline constexpr std::string_view kStandardInput = "-";
inline constexpr std::string_view kStandardInputName = "standard input";

class DryRun {
 public:
  // Called with each trace object in the order of delivery, and with the journal entry that
  // completed it. Both are borrowed. The reading ends if it returns false.
  using Visitor = std::function<bool(const TesselObject& object, const EntryHeader& entry)>;
  // Called every few thousand entries with the part that is read, from 0 to 1, and the number of
  // entries read. A store may be younger than the period, so the part counts from its oldest entry.
  using Progress = std::function<void(double part, uint64_t entriesRead)>;

  // An absent store is the machine's own journal. kStandardInput can be read once.
  explicit DryRun(std::optional<std::string> store, Visitor visitor);

  // Reads the entries of the period. Returns an error if the store cannot be opened.
  std::optional<PlatformError> read(const Period& period, const Progress& progress);
  // Reads entries from `start` on and waits for new ones until the visitor returns false. Where no
  // journal is yet, says so once to `onWait` and waits for one. Returns an error if the store
  // cannot be read and time will not change that.
  std::optional<PlatformError> follow(Date start, const std::function<void()>& afterEachLook,
                                      const std::function<void(const std::string& reason)>& onWait);

  // The process that wrote the entry which the visitor was given. REQUIRES: the visitor is running.
  EntryProcess currentProcess() const { return extractor_.currentProcess(); }

  // The begins that wait for their end. They make no object before.
  void forEachOpen(const IntervalAssembler::OpenVisitor& visit) const {
    extractor_.forEachOpen(visit);
  }
  // The findings so far. Its facts about the store are those of the last reading.
  ExtractionReport report() const { return extractor_.report(storeReport_); }

 private:
  std::variant<std::unique_ptr<JournalStore>, PlatformError> openStore(TimeRange range);
  bool mayStillCome(const PlatformError& error) const;
  std::optional<PlatformError> readOnce(TimeRange range,
                                        const std::function<void(EntryStream&)>& process);

  const std::optional<std::string> store_;
  const Visitor visitor_;
  JournalExtractor extractor_;
  StoreReport storeReport_;
  bool refused_ = false;
};

}  // namespace tessel::ctl
