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
#include "platform/System.h"
#include "trace/IntervalAssembler.h"
#include "trace/Shares.h"
#include "trace/TracePointTable.h"

namespace tessel {

struct ExtractionLimits {
  TracePointTableLimits table;
  OpenIntervalLimits openIntervals;
  ShareLimits shares;
};

// What sending has cost the process so far. The difference over a callback is what its object cost.
struct Spending {
  uint64_t steps = 0;       // of the throttle
  uint64_t sleptTicks = 0;  // in these steps, by the clock's ticks
  uint64_t rowBytes = 0;    // of the rows that were handed to the spool
};

// The books of all processing calls so far.
struct ExtractionReport {
  uint64_t entriesRead = 0;  // all entries, also ordinary log messages
  AssemblyCounts assembly;
  uint64_t delivered = 0;  // objects handed to a callback
  uint64_t refused = 0;    // objects of writers over their share, handed to none
  uint64_t pairs = 0;      // distinct (subsystem, category) that were admitted
  // By stopProcessing() or a callback that answered false, before the end was reached.
  bool stopped = false;
  std::optional<uint64_t> lastEntry;  // microseconds since 1970; absent if none was read
  StoreReport store;                  // its losses also cover the trace points of `assembly`
};

class JournalExtractor final : public TesselSupportObjectExtractor, private TraceObjectSink {
 public:
  // `systemStore` is the path of the system's own trace store. If it is absent, the extractor reads
  // the machine's journal.
  explicit JournalExtractor(std::optional<std::string> systemStore = std::nullopt,
                            const ExtractionLimits& limits = {});
  // Reports the progress of reading to `status`. REQUIRES: `status` outlives the extractor.
  void reportProgressTo(ServiceStatus& status) { status_ = &status; }
  // Lets each object cost its writer what its callback takes. Without this, time and text have no
  // shares. `spending` is called on the thread of the run; nobody else may spend meanwhile.
  // REQUIRES: `clock` outlives the extractor.
  void chargeBy(Clock& clock, std::function<Spending()> spending);

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
  // The start of the period that such a caller reads, in microseconds since 1970: what programs
  // lost before it is told apart.
  void startLossesAt(uint64_t rangeStart) { sourceLosses_.startAt(rangeStart); }
  const StopFlag& stopFlag() const { return stop_; }

  // The header of the entry that completed the object of the running callback. For an interval that
  // is its end. REQUIRES: a callback is running.
  const EntryHeader& currentEntry() const { return *current_; }
  // The process that wrote that entry. REQUIRES: a callback is running.
  EntryProcess currentProcess() const { return assembler_.process(); }
  // The begins that wait for their end.
  void forEachOpen(const IntervalAssembler::OpenVisitor& visit) const {
    assembler_.forEachOpen(visit);
  }
  // The books so far. processLogArchiveWithPath() fills in the store's part when it ends. A caller
  // of processEntries() reads a store of its own and passes that store's report.
  ExtractionReport report() const { return report(report_.store); }
  ExtractionReport report(const StoreReport& store) const;

 private:
  bool admits(const ObjectOffer& offer) override;
  void addTold(const ToldLosses& told) override;
  void deliverEvent(std::shared_ptr<const TesselEvent> event) override;
  void deliverInterval(std::shared_ptr<const TesselInterval> interval) override;
  void deliverAnimationInterval(std::shared_ptr<const TesselAnimationInterval> interval) override;
  template <typename Callback, typename Object>
  void deliver(const Callback& callback, const Object& object);
  template <typename Callback, typename Object>
  bool callMeasured(const Callback& callback, const Object& object);
  void charge(uint64_t ticks);

  const std::optional<std::string> systemStore_;
  TracePointTable table_;
  Writers writers_;
  Shares shares_;
  SourceLosses sourceLosses_;
  IntervalAssembler assembler_;
  StopFlag stop_ = false;
  bool refused_ = false;  // a callback answered false

  IntervalCallback interval_;
  AnimationIntervalCallback animationInterval_;
  EventCallback event_;
  ServiceStatus* status_ = nullptr;
  Clock* clock_ = nullptr;
  std::function<Spending()> spending_;
  Spending spent_;  // by the objects so far
  double nanosecondsPerTick_ = 0;

  const EntryHeader* current_ = nullptr;  // the entry that was read last
  ExtractionReport report_;
};

}  // namespace tessel
