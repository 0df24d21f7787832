// The reading loop, the books of a run, and the limit on pairs.

#include "trace/JournalExtractor.h"

#include <algorithm>
#include <utility>

#include "journal/JournalStore.h"
#include "platform/Invariant.h"
#include "platform/Log.h"

namespace tessel {

namespace {

// No entry is older than 1970, so an earlier date means the same as 1970.
uint64_t microsecondsSince1970(Date date) {
  return static_cast<uint64_t>(std::max<Date::rep>(0, date.time_since_epoch().count()));
}

// The books of the run must balance, or the summary of the run would be wrong. Every trace point is
// an event, a begin or an end. A begin met its end, was replaced, was dropped or still waits. An
// end met its begin or did not. Every event and every matched end made an object, which was
// delivered or refused by the limit on pairs.
void checkBooks(const ExtractionReport& report) {
  const AssemblyCounts& counts = report.assembly;
  const uint64_t begins = counts.pairedEnds + counts.replacedBegins + counts.droppedOpenIntervals +
                          counts.openIntervals;
  const uint64_t ends = counts.pairedEnds + counts.unmatchedEnds;
  const uint64_t refused = report.store.reading.losses.sum(LossCode::beyondPairLimit);
  TESSEL_INVARIANT(counts.tracePoints == counts.events + begins + ends);
  TESSEL_INVARIANT(counts.events + counts.pairedEnds == report.delivered + refused);
}

// We log at the end of the reading, one line for each loss of the list. A line for each damaged
// entry would fill the very journal that we read.
void logLosses(const Losses& losses) {
  if (!tesselReporterLog().isEnabled(LogLevel::debug)) return;
  for (const Loss& loss : losses.all()) {
    tesselReporterLog().debug("Trace store: lost %llu %@", loss.count, loss);
  }
}

}  // namespace

bool PairLimit::admits(StringRef subsystem, StringRef category) {
  const Pair pair{subsystem.hash(), category.hash()};
  // Both hashes are seeded, so the sum needs no seed. The odd factor keeps pairs of two equal
  // texts, and pairs whose texts change places, apart.
  const auto hash = static_cast<uint32_t>(pair.subsystem + pair.category * 0x9e3779b97f4a7c15u);
  const auto isPair = [&](uint32_t number) { return pairs_[number] == pair; };
  // Nearly every object has a pair that was admitted before.
  if (index_.find(hash, isPair) != FlatIndex::kNone) return true;
  const size_t text = subsystem.textOr("").size() + category.textOr("").size();
  if (pairs_.size() >= limits_.pairs || textBytes_ + text > limits_.textBytes) {
    ++refusals_;
    return false;
  }
  index_.add(hash, static_cast<uint32_t>(pairs_.size()));
  pairs_.push_back(pair);
  textBytes_ += text;
  return true;
}

JournalExtractor::JournalExtractor(std::optional<std::string> systemStore,
                                   const ExtractionLimits& limits)
    : systemStore_(std::move(systemStore)),
      table_(limits.table),
      pairs_(limits.pairs),
      assembler_(table_, *this, limits.openIntervals) {}

void JournalExtractor::setIntervalCompletionProcessingBlock(IntervalCallback callback) {
  interval_ = std::move(callback);
}

void JournalExtractor::setAnimationIntervalCompletionProcessingBlock(
    AnimationIntervalCallback callback) {
  animationInterval_ = std::move(callback);
}

void JournalExtractor::setEmitEventProcessingBlock(EventCallback callback) {
  event_ = std::move(callback);
}

// The flag hands over no other data, so a relaxed store is enough.
void JournalExtractor::stopProcessing() { stop_.store(true, std::memory_order_relaxed); }

bool JournalExtractor::processLogArchiveWithPath(const std::optional<std::string>& path,
                                                 Date startDate, Date endDate,
                                                 std::optional<PlatformError>& errorOut) {
  if (stop_.load(std::memory_order_relaxed)) {
    report_.stopped = true;
    return true;
  }
  const TimeRange range{microsecondsSince1970(startDate), microsecondsSince1970(endDate)};
  auto opened = JournalStore::open(path ? path : systemStore_, range, table_, stop_, status_);
  if (auto* error = std::get_if<PlatformError>(&opened)) {
    errorOut = std::move(*error);
    return false;
  }
  JournalStore& store = *std::get<std::unique_ptr<JournalStore>>(opened);
  processEntries(store.entries());
  report_.store = store.report();
  logLosses(report().store.reading.losses);
  return true;
}

// The loop looks at the stop flag between two entries only. So it finishes each entry that it
// began, and the books balance wherever a stop ends it.
void JournalExtractor::processEntries(EntryStream& entries) {
  while (!refused_ && !stop_.load(std::memory_order_relaxed) && entries.next()) {
    ++report_.entriesRead;
    const Entry entry = entries.entry();
    current_ = &entry.header;
    assembler_.consume(entry);
  }
  checkBooks(report());
  report_.stopped = refused_ || stop_.load(std::memory_order_relaxed);
}

// A caller may go on processing after a report, and the counts of the assembler grow. So report_
// keeps only the losses of the store, and each report adds the others to its own copy.
ExtractionReport JournalExtractor::report(const StoreReport& store) const {
  ExtractionReport report = report_;
  report.assembly = assembler_.counts();
  report.pairs = pairs_.pairs();
  report.store = store;
  Losses& losses = report.store.reading.losses;
  addLosses(report.assembly, losses);
  losses.add(LossCode::beyondPairLimit, "too many pairs of subsystem and category", {},
             pairs_.refusals());
  return report;
}

std::optional<StoreReading> JournalExtractor::reading() const {
  if (report_.store.files.empty()) return std::nullopt;  // the store could not be opened
  return report().store.reading;
}

bool JournalExtractor::admits(StringRef subsystem, StringRef category) {
  return pairs_.admits(subsystem, category);
}

// We count before the call, because a callback that answers false did receive its object.
template <typename Callback, typename Object>
void JournalExtractor::deliver(const Callback& callback, const Object& object) {
  ++report_.delivered;
  if (callback && !callback(object)) refused_ = true;
}

void JournalExtractor::deliverEvent(std::shared_ptr<const TesselEvent> event) {
  deliver(event_, event);
}

void JournalExtractor::deliverInterval(std::shared_ptr<const TesselInterval> interval) {
  deliver(interval_, interval);
}

void JournalExtractor::deliverAnimationInterval(
    std::shared_ptr<const TesselAnimationInterval> interval) {
  deliver(animationInterval_, interval);
}

}  // namespace tessel
