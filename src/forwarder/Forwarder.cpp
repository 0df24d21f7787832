// Delivering round after round.
//
// A collector refuses a batch as a whole and does not say which record is at fault. Halving finds
// it: one bad record among 512 costs about 20 requests, and the good ones still arrive in order.
// Sending each record alone after a refusal was discarded, because it costs 512 requests.
//
// A refusal alone proves nothing: a collector that is itself at fault refuses everything, and good
// rows that were taken for bad would be lost to the fleet. So a row is set aside only if it was
// refused, another row was accepted since, and it is refused alone once more. Where no other row is
// at hand, one from elsewhere in the spool is sent in its place. If that is refused, too, nothing
// moves, and the next round tries again. The price is that a spool with nothing but refused rows
// stands still until a good one comes.
//
// A status that says nothing about a record ends the round. But a gateway may answer so to one
// record alone, and all others must not wait for it for ever. So the next round takes every answer
// for one about a record, as soon as another row has been accepted. Such a record is set aside only
// after three rounds, because a collector that fails now and then would give it away otherwise.

#include "forwarder/Forwarder.h"

#include <algorithm>
#include <utility>

#include "platform/Invariant.h"
#include "statora/ForwarderLock.h"

namespace tessel {

namespace {

// So many records refused alone, with none accepted between them, look like a collector at fault.
// Each further one would cost a request in every round.
constexpr uint32_t kRefusedInARow = 4;
// Rounds in a row without an answer that makes sense, after which one record may be the reason: its
// content may bring the collector down. With the usual waits they take ten minutes.
constexpr uint32_t kFailuresBeforeProbing = 8;
// Rounds in which a record must be refused alone if the status is not about content.
constexpr uint32_t kRoundsBeforeSettingAside = 3;
// Rows whose rounds are counted. More of them would not fit into the table of refused rows.
constexpr size_t kMostCounted = 10'000;

// A line that cannot carry so many bytes in 30 seconds carries nothing. Where such a request breaks
// off, its size is not the reason.
constexpr size_t kNeverTooSlow = size_t{16} << 10;

// Free space is given back in small steps, because a send of the service may wait for the lock that
// each step holds. The breaks let such a send through. The number of steps is bounded, because no
// new event is delivered before the last step.
constexpr int kPagesGivenBackAtOnce = 64;
constexpr int kStepsAtOnce = 50;
constexpr std::chrono::milliseconds kBetweenSteps{20};

size_t bytesOf(std::span<const OutgoingRecord> records) {
  size_t bytes = 0;
  for (const OutgoingRecord& record : records) bytes += record.text.size();
  return bytes;
}

}  // namespace

Forwarder::Forwarder(World world, const ForwarderOptions& options)
    : world_(std::move(world)),
      options_(options),
      backoff_(options.firstRetry, options.longestRetry),
      pace_(options.recordsPerSecond),
      size_(options.maxBytes) {}

ForwarderOutcome Forwarder::deliverAll() {
  outcome_ = ForwarderOutcome::delivered;
  reason_.clear();
  answer_ = {};
  suspects_.clear();
  leftBehind_ = 0;
  refusedInARow_ = 0;
  acceptedBeforeRound_ = accepted_;
  probing_ = heldRounds_ > 0 || failures_ >= kFailuresBeforeProbing;
  if (world_.state.exists() && open() && acknowledgeTaken()) deliverRows();
  endRound();
  return outcome_;
}

bool Forwarder::open() {
  const SqliteStatus opened = world_.state.open();
  if (world_.state.generation() != generation_) {
    // The service has begun a new spool. The numbers of its rows mean other events.
    taken_.clear();
    refusedRounds_.clear();
    provedWritable_ = false;
    generation_ = world_.state.generation();
  }
  return opened.ok() || failBySpool(opened);
}

bool Forwarder::deliverRows() {
  world_.state.shortenDelivered(world_.clock.now());
  for (int64_t after = 0;;) {
    std::vector<SpooledEvent> events =
        world_.state.oldest(options_.maxRecords, size_.bytes(), after);
    SqliteStatus status = world_.state.status();
    if (status.ok() && events.empty()) break;
    // What the collector takes must be acknowledged. A spool that cannot be written would make us
    // send the same rows again and again.
    if (status.ok()) status = world_.state.proveWritable(!std::exchange(provedWritable_, true));
    // The service's commits may not be on disk yet. If a power cut took a row back after we sent
    // it, the service would give its id to another event, and the collector would drop that one as
    // a duplicate. So nothing leaves before the disk has it, at the price of one flush a batch.
    if (status.ok()) status = world_.state.flushLog();
    if (!status.ok()) return failBySpool(status);
    const Batch batch =
        cutBatch(std::move(events), world_.encoder, world_.state.spoolId(), size_.bytes());
    after = batch.lastId;
    if (!deliverBatch(batch)) return false;
    sayProgress();
  }
  leftBehind_ += suspects_.size();
  if (leftBehind_ > 0)
    return fail(ForwarderOutcome::held, std::to_string(leftBehind_) +
                                            (leftBehind_ == 1 ? " event is" : " events are") +
                                            " refused and wait: " + leftBehindWords_);
  // Everything is delivered, so shortening the file delays no event that waits now.
  for (int step = 0; step < kStepsAtOnce; ++step) {
    if (!world_.state.shrink(kPagesGivenBackAtOnce) || !takeBreak(kBetweenSteps)) break;
  }
  return true;
}

bool Forwarder::deliverBatch(const Batch& batch) {
  const auto accounted = [this] { return settled() - scouted_ + suspects_.size() + leftBehind_; };
  const uint64_t before = accounted();
  if (!setMalformedAside(batch)) return false;
  std::vector<Part> parts;
  if (!batch.records.empty()) parts.push_back({batch.records, accepted_});
  while (!parts.empty()) {
    const Part part = parts.back();
    parts.pop_back();
    const Records records = part.records;
    const Sent sent = send(records);
    if (sent == Sent::failed) return false;
    if (sent == Sent::accepted) continue;
    if (records.size() == 1) {
      suspects_.push_back({records.front(), part.acceptedBefore});
      leftBehindWords_ = answerWords(answer_);
      ++refusedInARow_;
    } else {
      // The first half goes on top, so that the records keep their order.
      parts.push_back({records.subspan(records.size() / 2), part.acceptedBefore});
      parts.push_back({records.first(records.size() / 2), part.acceptedBefore});
    }
    if (!mayGoOn(parts, batch.lastId)) return false;
  }
  if (!askAboutSuspects()) return false;
  // However the batch was split: each of its rows was delivered, set aside or left where it is, and
  // none twice.
  TESSEL_INVARIANT(accounted() - before == batch.records.size() + batch.malformed.size());
  return true;
}

// The rows that have left the spool so far.
uint64_t Forwarder::settled() const {
  const ForwarderCounters& counters = world_.state.counters();
  return counters.delivered + counters.setAside;
}

// Rows that cannot become records need no collector, so they must not wait for one.
bool Forwarder::setMalformedAside(const Batch& batch) {
  return std::all_of(batch.malformed.begin(), batch.malformed.end(), [this](const auto& event) {
    return setAside(event, 0, "the payload is not a flat JSON object");
  });
}

Forwarder::Sent Forwarder::send(Records part) {
  if (!takeBreak(pace_.waitAt(ticks()))) return Sent::failed;
  pace_.sent(part.size(), ticks());
  answer_ = world_.collector.post(world_.encoder.body(part));
  verdict_ = verdictOn(answer_, world_.encoder);
  ForwarderCounters& counters = world_.state.counters();
  ++counters.requests;
  counters.bytesSent += answer_.bytesSent;
  const size_t bytes = bytesOf(part);
  if (answer_.status == kContentTooLarge || (answer_.brokeWhileSending && bytes > kNeverTooSlow))
    size_.tooMuch(bytes);
  if (verdict_ != Verdict::accepted) {
    ++(answer_.status == 0 ? counters.failedRequests : counters.refusedRequests);
    return Sent::refused;
  }
  size_.taken(bytes);
  ++accepted_;
  failures_ = 0;
  refusedInARow_ = 0;
  // After a partial success nothing is sent again: the collector would take the good records twice.
  const PartialSuccess partial =
      world_.encoder.readSuccess(answer_.mediaType, answer_.body).value_or(PartialSuccess{});
  const uint64_t rejected = std::min<uint64_t>(partial.rejected, part.size());
  if (rejected > 0)
    kForwarderLog.error("The collector rejected %llu records: %@", rejected, partial.message);
  return acknowledge(part, rejected) ? Sent::accepted : Sent::failed;
}

// Rows that the spool does not let go are remembered. See acknowledgeTaken().
bool Forwarder::acknowledge(Records part, uint64_t rejected) {
  std::vector<const SpooledEvent*> rows;
  for (const OutgoingRecord& record : part) rows.push_back(&record.event);
  ForwarderState::Rows left = rows;
  const SqliteStatus status =
      world_.state.acknowledge(left, rejected, options_.destination, world_.clock.now());
  if (status.ok()) return true;
  for (const SpooledEvent* row : left) taken_.push_back(*row);
  takenRejected_ = rejected;
  return failBySpool(status);
}

bool Forwarder::acknowledgeTaken() {
  if (taken_.empty()) return true;
  std::vector<const SpooledEvent*> rows;
  for (const SpooledEvent& event : taken_) rows.push_back(&event);
  ForwarderState::Rows left = rows;
  const SqliteStatus status =
      world_.state.acknowledge(left, takenRejected_, options_.destination, world_.clock.now());
  taken_.erase(taken_.begin(), taken_.end() - static_cast<std::ptrdiff_t>(left.size()));
  return status.ok() || failBySpool(status);
}

// Whether to look on for the record that is at fault, after a request was refused.
bool Forwarder::mayGoOn(std::vector<Part>& parts, int64_t lastId) {
  if (!probing_ && verdict_ != Verdict::refused) return failByAnswer();
  // In a round after a failure the collector must show first that it takes anything at all. That
  // spares it the halving.
  const bool inDoubt = probing_ && accepted_ == acceptedBeforeRound_;
  if (!inDoubt && refusedInARow_ < kRefusedInARow) return true;
  return isAnotherAccepted(parts, lastId) || (reason_.empty() && failByAnswer());
}

// Sends one other row, from a random place: the rows near the refused one may be of the same kind.
// Rows behind the batch come first, because they leave its parts whole.
bool Forwarder::isAnotherAccepted(std::vector<Part>& parts, int64_t lastId) {
  std::vector<SpooledEvent> event = world_.state.someEvent(lastId, world_.chance());
  if (!event.empty()) {
    const Batch batch =
        cutBatch(std::move(event), world_.encoder, world_.state.spoolId(), size_.bytes());
    if (batch.records.empty() || send(batch.records) != Sent::accepted) return false;
    ++scouted_;
    return true;
  }
  if (parts.empty()) return false;
  const Part part = parts.front();
  const auto at = static_cast<size_t>(world_.chance() * static_cast<double>(part.records.size()));
  parts.erase(parts.begin());
  const auto keep = [&](Records records) {
    if (!records.empty()) parts.insert(parts.begin(), {records, part.acceptedBefore});
  };
  keep(part.records.first(at));
  keep(part.records.subspan(at + 1));
  const Sent sent = send(part.records.subspan(at, 1));
  if (sent == Sent::refused) suspects_.push_back({part.records[at], part.acceptedBefore});
  return sent == Sent::accepted;
}

// Asks again about each suspect since whose refusal another record was accepted. The others wait
// for a later batch, or for the end of the round.
bool Forwarder::askAboutSuspects() {
  std::vector<Suspect> waiting = std::exchange(suspects_, {});
  for (Suspect& suspect : waiting) {
    if (suspect.acceptedBefore == accepted_) {
      suspects_.push_back(std::move(suspect));
    } else if (!askAgain(suspect)) {
      return false;
    }
  }
  return true;
}

bool Forwarder::askAgain(const Suspect& suspect) {
  const int64_t id = suspect.record.event.id;
  const Sent sent = send({&suspect.record, 1});
  if (sent == Sent::failed) return false;
  if (sent == Sent::accepted) {
    refusedRounds_.erase(id);
    return true;
  }
  if (!probing_ && verdict_ != Verdict::refused) return failByAnswer();
  const std::string words = answerWords(answer_);
  if (!isAboutContent(answer_)) {
    if (refusedRounds_.size() >= kMostCounted && !refusedRounds_.contains(id))
      return leaveBehind(words);
    if (++refusedRounds_[id] < kRoundsBeforeSettingAside) return leaveBehind(words);
  }
  refusedRounds_.erase(id);
  return setAside(suspect.record.event, answer_.status, words);
}

bool Forwarder::setAside(const SpooledEvent& event, int64_t status, const std::string& words) {
  // No row is thrown away to make room for another.
  if (!world_.state.hasRoomToSetAside())
    return leaveBehind("no room is left to set it aside: " + words);
  const SqliteStatus stored = world_.state.setAside(event, status, words, world_.clock.now());
  if (!stored.ok()) return failBySpool(stored);
  kForwarderLog.error("Event %@ is set aside: %@", std::to_string(event.id), words);
  return true;
}

bool Forwarder::leaveBehind(const std::string& words) {
  ++leftBehind_;
  leftBehindWords_ = words;
  return true;
}

// Waits. False if somebody asked to stop.
bool Forwarder::takeBreak(std::chrono::nanoseconds time) {
  if (!world_.threads.wait(world_.stop, time)) return true;
  // This wait has used the signal up. Signal again, because later waits must see it too.
  world_.stop.signal();
  return fail(ForwarderOutcome::stopped, {});
}

bool Forwarder::fail(ForwarderOutcome outcome, std::string reason) {
  outcome_ = outcome;
  reason_ = std::move(reason);
  return false;
}

bool Forwarder::failBySpool(const SqliteStatus& status) {
  // The next proof has to be as long as an acknowledgement again: a full disk often has room for a
  // few bytes.
  provedWritable_ = false;
  if (status.code == kHeldByAnotherForwarder)
    return fail(ForwarderOutcome::lockedOut, "The spool cannot be used: " + status.reason);
  return fail(ForwarderOutcome::spoolFailed, "The spool cannot be used: " + status.reason);
}

bool Forwarder::failByAnswer() {
  // A request that was cancelled has no answer either.
  if (!takeBreak(std::chrono::nanoseconds{0})) return false;
  const std::string words = answerWords(answer_);
  if (verdict_ != Verdict::later)
    return fail(ForwarderOutcome::held, "The collector takes nothing: " + words);
  return fail(ForwarderOutcome::unreachable,
              (answer_.status == 0 ? "The collector cannot be reached: "
                                   : "The collector takes nothing for now: ") +
                  words);
}

// Counts how the round ended, and stores why for `tesselctl status`: nobody else can tell a
// collector that is away from a forwarder that hangs.
void Forwarder::endRound() {
  spoolFailures_ = outcome_ == ForwarderOutcome::spoolFailed ? spoolFailures_ + 1 : 0;
  pause_ = options_.interval;
  if (outcome_ == ForwarderOutcome::spoolFailed)
    pause_ = backoff_.wait(spoolFailures_, world_.chance(), {});
  if (outcome_ == ForwarderOutcome::delivered) heldRounds_ = 0;
  noteRest(outcome_ == ForwarderOutcome::delivered ? pause_ : std::chrono::nanoseconds{0});
  if (outcome_ != ForwarderOutcome::held && outcome_ != ForwarderOutcome::unreachable) return;
  ForwarderCounters& counters = world_.state.counters();
  if (outcome_ == ForwarderOutcome::unreachable) {
    pause_ = backoff_.wait(++failures_, world_.chance(), answer_.retryAfter);
    ++counters.retries;
  } else {
    ++heldRounds_;
    pause_ = options_.hold;
    if (answer_.retryAfter)
      pause_ = std::max(
          pause_, std::chrono::nanoseconds{backoff_.wait(1, world_.chance(), answer_.retryAfter)});
  }
  counters.lastError = leftBehind_ > 0 ? reason_ : answerWords(answer_);
  counters.lastErrorAt = microsecondsSince1970(world_.clock.now());
  const auto wait = std::chrono::duration_cast<std::chrono::microseconds>(pause_);
  counters.orderedUntil =
      answer_.retryAfter ? counters.lastErrorAt + static_cast<uint64_t>(wait.count()) : 0;
  world_.state.storeCounters();
}

void Forwarder::noteRest(std::chrono::nanoseconds time) {
  if (!world_.state.exists() || !world_.state.open().ok()) return;
  if (world_.state.counters().rest(world_.clock.now(), time)) world_.state.storeCounters();
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
