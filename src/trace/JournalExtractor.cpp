// The reading loop, the books of a run, and what the delivery of an object costs its writer.

#include "trace/JournalExtractor.h"

#include <algorithm>
#include <utility>

#include "journal/JournalStore.h"
#include "platform/Analytics.h"
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
// delivered, or refused because its writer had more than his share.
void checkBooks(const ExtractionReport& report) {
  const AssemblyCounts& counts = report.assembly;
  const uint64_t begins = counts.pairedEnds + counts.replacedBegins + counts.droppedOpenIntervals +
                          counts.openIntervals;
  const uint64_t ends = counts.pairedEnds + counts.unmatchedEnds;
  TESSEL_INVARIANT(counts.tracePoints == counts.events + begins + ends);
  TESSEL_INVARIANT(counts.events + counts.pairedEnds == report.delivered + report.refused);
}

// We log at the end of the reading, one line for each loss of the list. A line for each damaged
// entry would fill the very journal that we read.
void logLosses(const StoreReading& reading) {
  if (!tesselReporterLog().isEnabled(LogLevel::debug)) return;
  for (const std::string& path : reading.outsideRange)
    tesselReporterLog().debug("Trace store: of another period: %@", path);
  for (const Loss& loss : reading.losses.all()) {
    tesselReporterLog().debug("Trace store: lost %llu %@", loss.count, loss);
  }
}

}  // namespace

JournalExtractor::JournalExtractor(std::optional<std::string> systemStore,
                                   const ExtractionLimits& limits)
    : systemStore_(std::move(systemStore)),
      table_(limits.table),
      shares_(writers_, limits.shares),
      sourceLosses_(writers_, [this](const Origin& one) { return shares_.admitsCounter(one); }),
      assembler_(table_, writers_, *this, limits.openIntervals) {}

void JournalExtractor::chargeBy(Clock& clock, std::function<Spending()> spending) {
  clock_ = &clock;
  const Timebase timebase = clock.timebase();
  nanosecondsPerTick_ =
      static_cast<double>(timebase.numerator) / static_cast<double>(timebase.denominator);
  spending_ = std::move(spending);
  spent_ = spending_();  // earlier runs of the process have spent as well
}

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
  const TimeRange range{microsecondsSince1970(startDate), microsecondsSince1970(endDate)};
  report_.store.reading.rangeStart = range.start;
  report_.store.reading.rangeEnd = range.end;
  startLossesAt(range.start);
  if (stop_.load(std::memory_order_relaxed)) {
    report_.stopped = true;
    return true;
  }
  auto opened = JournalStore::open(path ? path : systemStore_, range, table_, stop_, status_);
  if (auto* error = std::get_if<PlatformError>(&opened)) {
    errorOut = std::move(*error);
    return false;
  }
  JournalStore& store = *std::get<std::unique_ptr<JournalStore>>(opened);
  processEntries(store.entries());
  report_.store = store.report();
  logLosses(report().store.reading);
  return true;
}

// The loop looks at the stop flag between two entries only. So it finishes each entry that it
// began, and the books balance wherever a stop ends it.
void JournalExtractor::processEntries(EntryStream& entries) {
  bool reachedEnd = false;
  std::optional<uint64_t> last = report_.lastEntry;
  while (!refused_ && !stop_.load(std::memory_order_relaxed)) {
    if (!entries.next()) {
      // A stream may end because of the stop. A stop that comes later cuts nothing short.
      reachedEnd = !stop_.load(std::memory_order_relaxed);
      break;
    }
    ++report_.entriesRead;
    const Entry entry = entries.entry();
    current_ = &entry.header;
    last = entry.header.realtime;
    assembler_.consume(entry);
  }
  report_.lastEntry = last;
  checkBooks(report());
  report_.stopped = !reachedEnd;
}

// A caller may go on processing after a report, and the counts of the assembler grow. So report_
// keeps only the losses of the store, and each report adds the others to its own copy.
ExtractionReport JournalExtractor::report(const StoreReport& store) const {
  ExtractionReport report = report_;
  report.assembly = assembler_.counts();
  report.pairs = shares_.pairs();
  report.refused = shares_.refusals();
  report.store = store;
  StoreReading& reading = report.store.reading;
  reading.lastEntry = report_.lastEntry;
  reading.stopped = report_.stopped;
  addLosses(report.assembly, reading.losses);
  writers_.addLosses(reading.losses);
  return report;
}

std::optional<StoreReading> JournalExtractor::reading() const {
  // Without files the store could not be opened, unless a stop came before.
  if (report_.store.files.empty() && !report_.stopped) return std::nullopt;
  return report().store.reading;
}

bool JournalExtractor::admits(const ObjectOffer& offer) { return shares_.admits(offer); }

void JournalExtractor::addTold(const ToldLosses& told) { sourceLosses_.add(told); }

// We count before the call, because a callback that answers false did receive its object. Only what
// is marked for telemetry can be sent. Anything else costs a callback less than two looks at the
// clock would, so it is not measured.
template <typename Callback, typename Object>
void JournalExtractor::deliver(const Callback& callback, const Object& object) {
  ++report_.delivered;
  if (!callback) return;
  const bool measured = spending_ && object->telemetryEnabled();
  if (!(measured ? callMeasured(callback, object) : callback(object))) refused_ = true;
}

template <typename Callback, typename Object>
bool JournalExtractor::callMeasured(const Callback& callback, const Object& object) {
  const uint64_t began = clock_->continuousTicks();
  const bool answer = callback(object);
  charge(clock_->continuousTicks() - began);
  return answer;
}

// The throttle sleeps in each tenth step for all ten. So a step costs its writer its tenth part,
// whoever makes the tenth, and the sleep itself is taken out of the measured time.
void JournalExtractor::charge(uint64_t ticks) {
  const Spending now = spending_();
  const uint64_t slept = now.sleptTicks - spent_.sleptTicks;
  // Both are differences of the same clock, and the sleep lies within the callback.
  TESSEL_INVARIANT(slept <= ticks);
  const std::chrono::nanoseconds steps = (now.steps - spent_.steps) * Throttle::kTimeOfAStep;
  const auto rest = static_cast<double>(ticks - slept) * nanosecondsPerTick_;
  shares_.charge(assembler_.writer(), now.rowBytes - spent_.rowBytes,
                 static_cast<uint64_t>(steps.count()) + static_cast<uint64_t>(rest));
  spent_ = now;
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
