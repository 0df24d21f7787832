// JournalExtractor: the trace-extraction service over a trace store.
//
// It stands on top of this folder. TracePointFields says which journal fields a trace point has.
// TracePointTable turns each FIELD=value of a store into a token. OpenIntervals keeps the begins
// that wait, IntervalAssembler pairs them with their ends and makes the objects, and this class
// reads the store and delivers them.
//
// It reads the store once, entry by entry on the calling thread, and calls back in between. A
// callback that answers false ends the processing call as a stop does. An extractor that was
// stopped stays stopped.
//
// Threads: stopProcessing() may come from any thread at any time; everything else belongs to the
// thread of the run.

#pragma once

#include <optional>
#include <string>
#include <vector>

#include "journal/EntryStream.h"
#include "journal/StoreReport.h"
#include "objects/TesselSupportObjectExtractor.h"
#include "platform/FlatIndex.h"
#include "platform/System.h"
#include "trace/IntervalAssembler.h"
#include "trace/TracePointTable.h"

namespace tessel {

// What a run does for each (subsystem, category) pair at its end takes time and memory, and a
// writer may make up as many pairs as it likes. 4,096 is more than a machine full of programs has;
// 4 MiB of text give each of them names of 1 KiB.
struct PairLimits {
  size_t pairs = 4096;
  size_t textBytes = size_t{4} * 1024 * 1024;  // of all subsystems and categories together
};

// Lets in so many distinct pairs and refuses the others. A pair is known by its two seeded 64-bit
// hashes, so that no text is kept; that two pairs ever meet in both is out of reach of any writer.
class PairLimit {
 public:
  explicit PairLimit(PairLimits limits = {}) : limits_(limits) {}

  // Whether the pair is among those that were let in, or there is room to let it in. Counts each
  // refusal.
  bool admits(StringRef subsystem, StringRef category);
  size_t pairs() const { return pairs_.size(); }
  uint64_t refusals() const { return refusals_; }

 private:
  struct Pair {
    uint64_t subsystem = 0;
    uint64_t category = 0;

    bool operator==(const Pair&) const = default;
  };

  const PairLimits limits_;
  std::vector<Pair> pairs_;  // those that were let in
  FlatIndex index_;          // of pairs_
  size_t textBytes_ = 0;
  uint64_t refusals_ = 0;
};

struct ExtractionLimits {
  TracePointTableLimits table;
  OpenIntervalLimits openIntervals;
  PairLimits pairs;
};

// What the processing calls found, beside what they delivered.
struct ExtractionReport {
  uint64_t entriesRead = 0;  // trace points or not
  AssemblyCounts assembly;
  uint64_t delivered = 0;  // objects handed to a callback
  uint64_t pairs = 0;      // distinct (subsystem, category) among them
  bool stopped = false;    // by stopProcessing() or a callback that answered false
  StoreReport store;       // its losses include those of entries that were read
};

class JournalExtractor final : public TesselSupportObjectExtractor, private TraceObjectSink {
 public:
  // `systemStore` is where the system's own trace store is; absent, it is the machine's journal.
  explicit JournalExtractor(std::optional<std::string> systemStore = std::nullopt,
                            const ExtractionLimits& limits = {});
  // Tells `status`, which must outlive the extractor, every few thousand entries that it gets on.
  void reportProgressTo(ServiceStatus& status) { status_ = &status; }

  void setIntervalCompletionProcessingBlock(IntervalCallback callback) override;
  void setAnimationIntervalCompletionProcessingBlock(AnimationIntervalCallback callback) override;
  void setEmitEventProcessingBlock(EventCallback callback) override;
  // This extractor builds no composite timelines, so either answer changes nothing.
  void setBuildAnimationCompositeIntervalTimelines(bool) override {}
  bool processLogArchiveWithPath(const std::optional<std::string>& path, Date startDate,
                                 Date endDate, std::optional<PlatformError>& errorOut) override;
  void stopProcessing() override;
  uint64_t processedEventCount() const override { return report_.entriesRead; }
  std::optional<StoreReading> reading() const override;

  // Delivers what `entries` holds until it ends or a stop takes effect. May be called again, with
  // the same stream after it grew or with another: intervals that are open stay open in between.
  // REQUIRES: the stream was made with tokenizer() and stopFlag().
  void processEntries(EntryStream& entries);
  FieldTokenizer& tokenizer() { return table_; }
  const StopFlag& stopFlag() const { return stop_; }

  // Where the entry stands that the object of the running callback came from; an interval comes
  // from its end. REQUIRES: a callback is running.
  const EntryHeader& currentEntry() const { return *current_; }
  // About what was processed so far. The store's part is there after the processing call; who
  // reads a store of his own hands in what that one reports.
  ExtractionReport report() const { return report(report_.store); }
  ExtractionReport report(const StoreReport& store) const;

 private:
  bool admits(StringRef subsystem, StringRef category) override;
  void deliverEvent(std::shared_ptr<const TesselEvent> event) override;
  void deliverInterval(std::shared_ptr<const TesselInterval> interval) override;
  void deliverAnimationInterval(std::shared_ptr<const TesselAnimationInterval> interval) override;
  template <typename Callback, typename Object>
  void deliver(const Callback& callback, const Object& object);

  const std::optional<std::string> systemStore_;
  TracePointTable table_;
  PairLimit pairs_;
  IntervalAssembler assembler_;
  StopFlag stop_ = false;
  bool refused_ = false;  // a callback answered false

  IntervalCallback interval_;
  AnimationIntervalCallback animationInterval_;
  EventCallback event_;
  ServiceStatus* status_ = nullptr;

  const EntryHeader* current_ = nullptr;  // while an entry is looked at
  ExtractionReport report_;
};

}  // namespace tessel
