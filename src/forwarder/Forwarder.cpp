// Delivering batch after batch.
//
// A collector refuses a batch as a whole and does not say which record is at fault. Halving finds
// it: one bad record among 512 costs about 20 requests, and the good ones still arrive in order.
// Sending each record alone after a refusal was discarded, because it costs 512 requests.
//
// A collector that is itself at fault may refuse everything. Halving would then set the whole spool
// aside. So the number of refusals in a row is limited: deliverAll() sets at most that many records
// aside and then ends. The next call begins to count anew.

#include "forwarder/Forwarder.h"

#include <algorithm>
#include <utility>

#include "platform/Invariant.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// Free space is given back in small steps, because a send of the service may wait for the lock that
// each step holds. The breaks let such a send through. The number of steps is bounded, because no
// new event is delivered before the last step.
constexpr int kPagesGivenBackAtOnce = 64;
constexpr int kStepsAtOnce = 50;
constexpr std::chrono::milliseconds kBetweenSteps{20};

}  // namespace

Forwarder::Forwarder(World world, const ForwarderOptions& options)
    : world_(std::move(world)),
      options_(options),
      backoff_(options.firstRetry, options.longestRetry),
      pace_(options.recordsPerSecond) {}

ForwarderOutcome Forwarder::deliverAll() {
  refusals_ = 0;
  reason_.clear();
  world_.state.shortenDelivered(world_.clock.now());
  for (;;) {
    std::vector<SpooledEvent> events = world_.state.oldest(options_.maxRecords, options_.maxBytes);
    SqliteStatus status = world_.state.status();
    // The service's commits may not be on disk yet. If a power cut took a row back after we sent
    // it, the service would give its id to another event, and the collector would drop that one as
    // a duplicate. So nothing leaves before the disk has it, at the price of one flush a batch.
    if (status.ok() && !events.empty()) status = world_.state.flushLog();
    if (!status.ok()) {
      reason_ = status.reason;
      return ForwarderOutcome::spoolFailed;
    }
    if (events.empty()) break;
    const Batch batch =
        cutBatch(std::move(events), world_.encoder, world_.state.spoolId(), options_.maxBytes);
    if (const ForwarderOutcome outcome = deliverBatch(batch);
        outcome != ForwarderOutcome::delivered) {
      world_.state.storeCounters();
      return outcome;
    }
    sayProgress();
  }
  // Everything is delivered, so shortening the file delays no event that waits now.
  for (int step = 0; step < kStepsAtOnce; ++step) {
    if (!world_.state.shrink(kPagesGivenBackAtOnce) || !takeBreak(kBetweenSteps)) break;
  }
  return ForwarderOutcome::delivered;
}

ForwarderOutcome Forwarder::deliverBatch(const Batch& batch) {
  const uint64_t settledBefore = settled();
  // Rows that cannot become records need no collector, so they must not wait for one.
  for (const SpooledEvent& event : batch.malformed) {
    if (!setAside(event, 0, "the payload is not a flat JSON object")) return outcome_;
  }
  std::vector<Records> parts;
  if (!batch.records.empty()) parts.emplace_back(batch.records);
  while (!parts.empty()) {
    const Records part = parts.back();
    parts.pop_back();
    switch (send(part)) {
      case Sent::accepted:
        break;
      case Sent::failed:
        return outcome_;
      case Sent::refused:
        // The first half goes on top, so that the records keep their order.
        parts.push_back(part.subspan(part.size() / 2));
        parts.push_back(part.first(part.size() / 2));
        break;
    }
  }
  // However the batch was split: each of its rows was delivered or set aside, and none twice.
  TESSEL_INVARIANT(settled() - settledBefore == batch.records.size() + batch.malformed.size());
  return ForwarderOutcome::delivered;
}

// The rows that have left the spool so far.
uint64_t Forwarder::settled() const {
  const ForwarderCounters& counters = world_.state.counters();
  return counters.delivered + counters.setAside;
}

Forwarder::Sent Forwarder::send(Records part) {
  // Encoded once: every attempt sends the same bytes.
  const std::string body = world_.encoder.body(part);
  for (uint32_t failures = 1;; ++failures) {
    if (!takeBreak(pace_.waitAt(ticks()))) return fail(ForwarderOutcome::stopped, "asked to stop");
    pace_.sent(part.size(), ticks());
    const CollectorAnswer answer = world_.collector.post(body);
    ForwarderCounters& counters = world_.state.counters();
    ++counters.requests;
    counters.bytesSent += answer.bytesSent;
    const Verdict verdict = verdictOn(answer, world_.encoder);
    if (verdict == Verdict::accepted || verdict == Verdict::refused) return settle(part, answer);
    noteFailure(answer);
    if (verdict == Verdict::hold) return fail(ForwarderOutcome::held, answerWords(answer));
    if (failures == options_.maxAttempts)
      return fail(ForwarderOutcome::unreachable, answerWords(answer));
    if (!waitToRetry(answer, failures)) return fail(ForwarderOutcome::stopped, "asked to stop");
  }
}

bool Forwarder::waitToRetry(const CollectorAnswer& answer, uint32_t failures) {
  const std::string words = answerWords(answer);
  // The log tells this once per batch. The status shows the latest answer.
  if (failures == 1) kForwarderLog.error("The collector takes nothing for now: %@", words);
  world_.status.say("Waiting for the collector: " + words);
  const auto wait = backoff_.wait(failures, world_.chance(), answer.retryAfter);
  ForwarderCounters& counters = world_.state.counters();
  ++counters.retries;
  if (answer.retryAfter)
    counters.orderedUntil =
        counters.lastErrorAt + static_cast<uint64_t>(std::chrono::microseconds(wait).count());
  world_.state.storeCounters();
  // An outage may last for days, and delivered rows are past theirs meanwhile.
  world_.state.shortenDelivered(world_.clock.now());
  return takeBreak(wait);
}

// For `tesselctl status`: nobody else can tell a collector that is away from a forwarder that
// hangs. Whoever calls this stores the counters.
void Forwarder::noteFailure(const CollectorAnswer& answer) {
  ForwarderCounters& counters = world_.state.counters();
  counters.lastError = answerWords(answer);
  counters.lastErrorAt = static_cast<uint64_t>(world_.clock.now().time_since_epoch().count());
  counters.orderedUntil = 0;
}

Forwarder::Sent Forwarder::settle(Records part, const CollectorAnswer& answer) {
  if (verdictOn(answer, world_.encoder) == Verdict::refused) {
    if (part.size() > 1) return Sent::refused;
    if (!setAside(part.front().event, answer.status, answerWords(answer))) return Sent::failed;
    if (++refusals_ < options_.refusalsInARow) return Sent::accepted;
    noteFailure(answer);
    return fail(ForwarderOutcome::held, "record after record is refused: " + answerWords(answer));
  }
  refusals_ = 0;
  // After a partial success nothing is sent again: the collector would take the good records twice.
  const PartialSuccess partial =
      world_.encoder.readSuccess(answer.mediaType, answer.body).value_or(PartialSuccess{});
  if (partial.rejected > 0) {
    kForwarderLog.error("The collector rejected %llu records: %@", partial.rejected,
                        partial.message);
  }
  std::vector<const SpooledEvent*> rows;
  for (const OutgoingRecord& record : part) rows.push_back(&record.event);
  const SqliteStatus status =
      world_.state.acknowledge(rows, partial.rejected, options_.destination, world_.clock.now());
  return status.ok() ? Sent::accepted : fail(ForwarderOutcome::spoolFailed, status.reason);
}

bool Forwarder::setAside(const SpooledEvent& event, int64_t status, const std::string& words) {
  const SqliteStatus stored = world_.state.setAside(event, status, words, world_.clock.now());
  if (!stored.ok()) {
    fail(ForwarderOutcome::spoolFailed, stored.reason);
    return false;
  }
  kForwarderLog.error("Event %@ is set aside: %@", std::to_string(event.id), words);
  return true;
}

// Waits. False if somebody asked to stop.
bool Forwarder::takeBreak(std::chrono::nanoseconds time) {
  if (!world_.clock.wait(world_.stop, time)) return true;
  // This wait has used the signal up. Signal again, because later waits must see it too.
  world_.stop.signal();
  return false;
}

Forwarder::Sent Forwarder::fail(ForwarderOutcome outcome, std::string reason) {
  outcome_ = outcome;
  reason_ = std::move(reason);
  return Sent::failed;
}

void Forwarder::sayProgress() {
  const ForwarderCounters& counters = world_.state.counters();
  world_.status.progress();
  world_.status.say("Delivered " + std::to_string(counters.delivered) + ", waiting " +
                    std::to_string(world_.state.waiting()) + ", set aside " +
                    std::to_string(counters.setAside));
}

std::chrono::nanoseconds Forwarder::ticks() {
  const Timebase base = world_.clock.timebase();
  return std::chrono::nanoseconds{world_.clock.continuousTicks() * base.numerator /
                                  base.denominator};
}

}  // namespace tessel
