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
#include <cmath>
#include <utility>

#include "platform/Invariant.h"
#include "platform/Text.h"

namespace tessel {

// Verdicts, waits and pace.
//
// OTLP lists the statuses after which a client may send again. We add one rule: 401, 403, 404, 405,
// 407 and redirects are about the way to the collector and not about the records. If they counted
// as refusals, a wrong password would set good records aside.

namespace {

// A collector may ask for a longer wait by mistake. After an hour it is asked again.
constexpr std::chrono::seconds kLongestAsked{3600};
// Bytes of a collector's answer that we quote: enough for a sentence, short enough for a log line.
constexpr size_t kMaxWords = 300;

}  // namespace

Verdict verdictOn(const CollectorAnswer& answer) {
  switch (answer.status) {
    case 0:
    case 429:
    case 502:
    case 503:
    case 504:
      return Verdict::later;
    case 401:
    case 403:
    case 404:
    case 405:
    case 407:
      return Verdict::hold;
    default:
      break;
  }
  if (answer.status / 100 == 2) return Verdict::accepted;
  return answer.status / 100 == 3 ? Verdict::hold : Verdict::refused;
}

std::string answerWords(const CollectorAnswer& answer) {
  if (answer.status == 0) return plainText(answer.error, " ");
  std::string words = std::to_string(answer.status);
  if (!answer.body.empty())
    words += ": " + plainText(std::string_view(answer.body).substr(0, kMaxWords), " ");
  return words;
}

std::chrono::milliseconds Backoff::wait(uint32_t failures, double chance,
                                        std::optional<std::chrono::seconds> asked) const {
  // 30 doublings bring any wait above the longest one. More could overflow to infinity.
  const double doublings = std::min(failures - 1, uint32_t{30});
  const double full = std::min(static_cast<double>(first_.count()) * std::exp2(doublings),
                               static_cast<double>(most_.count()));
  const std::chrono::milliseconds own{static_cast<int64_t>(full * (0.5 + chance / 2))};
  if (!asked) return own;
  const std::chrono::milliseconds wanted = std::min(*asked, kLongestAsked);
  const auto spread = static_cast<double>(std::max(first_, wanted / 2).count());
  return wanted + std::chrono::milliseconds{static_cast<int64_t>(chance * spread)};
}

std::chrono::nanoseconds Pace::waitAt(std::chrono::nanoseconds now) const {
  return std::max(next_ - now, std::chrono::nanoseconds{0});
}

void Pace::sent(uint64_t records, std::chrono::nanoseconds now) {
  if (recordsPerSecond_ == 0) return;
  // The wait comes after the request that causes it, so the first one of a day goes out at once.
  next_ = now + std::chrono::nanoseconds{std::chrono::seconds{1}} * records / recordsPerSecond_;
}

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
    const Verdict verdict = verdictOn(answer);
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
  if (verdictOn(answer) == Verdict::refused) {
    if (part.size() > 1) return Sent::refused;
    if (!setAside(part.front().event, answer.status, answerWords(answer))) return Sent::failed;
    if (++refusals_ < options_.refusalsInARow) return Sent::accepted;
    noteFailure(answer);
    return fail(ForwarderOutcome::held, "record after record is refused: " + answerWords(answer));
  }
  refusals_ = 0;
  // After a partial success nothing is sent again: the collector would take the good records twice.
  const PartialSuccess partial = world_.encoder.partialSuccess(answer.body);
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
