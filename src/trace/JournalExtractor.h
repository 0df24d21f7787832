// JournalExtractor reads a trace store and delivers its trace objects to callbacks.
//
// It is the top of this folder. TracePointFields says which journal fields a trace point has.
// TracePointTable turns each FIELD=value of a store into a token. OpenIntervals keeps the begins
// that wait for their end. IntervalAssembler pairs begins with ends and makes the objects.
//
// A processing call reads the store entry by entry and runs the callbacks on the calling thread. A
// callback that answers false ends the call, as stopProcessing() does. After either, further
// processing calls read nothing.
//
// Threads: any thread may call stopProcessing() at any time. All other functions belong to the
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

// At its end a run spends time and memory on each (subsystem, category) pair, and a writer may make
// up any number of pairs. So there is a limit. A machine full of programs has fewer than 4,096
// pairs. 4 MiB of text leave 1 KiB for the names of each.
struct PairLimits {
  size_t pairs = 4096;
  size_t textBytes = size_t{4} * 1024 * 1024;  // of all subsystems and categories together
};

// Admits distinct pairs up to the limits and refuses all further ones. To save memory it keeps two
// 64-bit hashes of a pair and no text. The hashes are seeded, so a writer cannot make up two pairs
// that share both.
class PairLimit {
 public:
  explicit PairLimit(PairLimits limits = {}) : limits_(limits) {}

  // True if the pair was admitted before or if there is room for it now. Counts each refusal.
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
  std::vector<Pair> pairs_;  // the admitted pairs
  FlatIndex index_;          // of pairs_
  size_t textBytes_ = 0;
  uint64_t refusals_ = 0;
};

struct ExtractionLimits {
  TracePointTableLimits table;
  OpenIntervalLimits openIntervals;
  PairLimits pairs;
};

// The books of all processing calls so far.
struct ExtractionReport {
  uint64_t entriesRead = 0;  // all entries, also ordinary log messages
  AssemblyCounts assembly;
  uint64_t delivered = 0;  // objects handed to a callback
  uint64_t pairs = 0;      // distinct (subsystem, category) that were admitted
  bool stopped = false;    // by stopProcessing() or a callback that answered false
  StoreReport store;       // its losses also cover the trace points of `assembly`
};

class JournalExtractor final : public TesselSupportObjectExtractor, private TraceObjectSink {
 public:
  // `systemStore` is the path of the system's own trace store. If it is absent, the extractor reads
  // the machine's journal.
  explicit JournalExtractor(std::optional<std::string> systemStore = std::nullopt,
                            const ExtractionLimits& limits = {});
  // Reports the progress of reading to `status`. REQUIRES: `status` outlives the extractor.
  void reportProgressTo(ServiceStatus& status) { status_ = &status; }

  void setIntervalCompletionProcessingBlock(IntervalCallback callback) override;
  void setAnimationIntervalCompletionProcessingBlock(AnimationIntervalCallback callback) override;
  void setEmitEventProcessingBlock(EventCallback callback) override;
  // This extractor builds no composite timelines, so the setting has no effect.
  void setBuildAnimationCompositeIntervalTimelines(bool) override {}
  bool processLogArchiveWithPath(const std::optional<std::string>& path, Date startDate,
                                 Date endDate, std::optional<PlatformError>& errorOut) override;
  void stopProcessing() override;
  uint64_t processedEventCount() const override { return report_.entriesRead; }
  std::optional<StoreReading> reading() const override;

  // Delivers the objects of `entries` until the stream ends or a stop takes effect. The caller may
  // call again, with another stream or with the same one after it grew. Open intervals stay open
  // from one call to the next.
  // REQUIRES: the stream was made with tokenizer() and stopFlag().
  void processEntries(EntryStream& entries);
  FieldTokenizer& tokenizer() { return table_; }
  const StopFlag& stopFlag() const { return stop_; }

  // The header of the entry that completed the object of the running callback. For an interval that
  // is its end. REQUIRES: a callback is running.
  const EntryHeader& currentEntry() const { return *current_; }
  // The books so far. processLogArchiveWithPath() fills in the store's part when it ends. A caller
  // of processEntries() reads a store of its own and passes that store's report.
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

  const EntryHeader* current_ = nullptr;  // the entry that was read last
  ExtractionReport report_;
};

}  // namespace tessel
