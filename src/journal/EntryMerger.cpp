// A heap of streams, with a shortcut for the case that one stream leads for a long time.

#include "journal/EntryMerger.h"

#include <algorithm>
#include <tuple>
#include <utility>

#include "platform/Invariant.h"

namespace tessel {

namespace {
// all_ merges files and whole sequences. A stream number below this is a file's; one from here on
// is a sequence's. No store has so many files.
constexpr uint32_t kFirstSequence = 0x80000000;
}  // namespace

bool comesBeforeByTime(const EntryHeader& a, const EntryHeader& b) {
  if (sameId(a.bootId, b.bootId) && a.monotonic != b.monotonic) return a.monotonic < b.monotonic;
  // Hash and boot decide between equal times. Otherwise the order would depend on which file was
  // opened first, and two runs over one store could differ.
  return std::tie(a.realtime, a.contentHash, a.bootId, a.monotonic) <
         std::tie(b.realtime, b.contentHash, b.bootId, b.monotonic);
}

void EntryMerger::add(std::unique_ptr<EntryStream> stream, uint32_t number) {
  TESSEL_INVARIANT(!started_);  // the heap is put in order once, by the first next()
  Source source{std::move(stream), nullptr, number};
  if (source.next()) heap_.push_back(std::move(source));
}

void EntryMerger::start() {
  if (std::exchange(started_, true)) return;
  for (size_t i = heap_.size() / 2; i-- > 0;) siftDown(i);
  runnerUp_ = findRunnerUp();
}

bool EntryMerger::next() {
  if (started_ && !heap_.empty()) [[likely]] {
    // The copies go first: they are compared with the front, so it must not have moved on yet.
    dropDuplicates();
    return leaderMoved(heap_.front().stream->next());
  }
  start();
  ++current_;
  return !heap_.empty() && !stop_.load(std::memory_order_relaxed);
}

// We remember which stream comes second: one comparison with it shows that nothing has to move.
bool EntryMerger::leaderMoved(bool more) {
  ++current_;
  if (more) heap_.front().header = &heap_.front().stream->header();
  if (!more) close(0);
  if (!more || (runnerUp_ != 0 && comesBefore(*heap_[runnerUp_].header, *heap_.front().header))) {
    siftDown(0);
    runnerUp_ = findRunnerUp();
  }
  return !heap_.empty() && !stop_.load(std::memory_order_relaxed);
}

// Skips the copies of the current entry in the other streams. A copy compares equal to the front,
// so in a heap nothing but another copy can stand between them. Therefore we look only at the two
// places below the front.
void EntryMerger::dropDuplicates() {
  for (size_t child = 1; child <= 2 && child < heap_.size(); ++child)
    while (child < heap_.size() && sameEntry(*heap_[child].header, *heap_.front().header))
      [[unlikely]] if (!skipCopy(child)) break;
}

void EntryMerger::close(size_t index) {
  std::swap(heap_[index], heap_.back());
  heap_.pop_back();
}

// In a heap the second stream is one of the two below the first.
size_t EntryMerger::findRunnerUp() const {
  if (heap_.size() < 2) return 0;
  return heap_.size() > 2 && comesBefore(*heap_[2].header, *heap_[1].header) ? 2 : 1;
}

void EntryMerger::siftDown(size_t index) {
  for (;;) {
    size_t first = index;
    for (size_t child = 2 * index + 1; child <= 2 * index + 2 && child < heap_.size(); ++child)
      if (comesBefore(*heap_[child].header, *heap_[first].header)) first = child;
    if (first == index) return;
    std::swap(heap_[index], heap_[first]);
    index = first;
  }
}

// A stream skips at most one copy: if it has the entry twice, the entry was written twice. False if
// it skipped one before. Otherwise siftDown() brings up the entry below it.
bool EntryMerger::skipCopy(size_t child) {
  if (heap_[child].skippedFor == current_) return false;
  heap_[child].skippedFor = current_;
  ++duplicates_;
  if (!heap_[child].next()) close(child);
  siftDown(child);
  runnerUp_ = findRunnerUp();
  return true;
}

void StoreMerger::add(std::unique_ptr<EntryStream> stream, uint32_t number, const Id128& sequence) {
  waiting_[sequence].emplace_back(std::move(stream), number);
}

bool StoreMerger::nextOfAll() {
  if (!waiting_.empty()) start();
  return findLeader(all_.next());
}

// The leader was moved to its next entry, or to its end, and may lead no longer.
bool StoreMerger::settle(bool more) {
  if (sequence_ != nullptr) more = sequence_->leaderMoved(more);
  return findLeader(all_.leaderMoved(more));
}

bool StoreMerger::findLeader(bool more) {
  leads_ = false;
  if (!more) return false;
  const uint32_t number = all_.leaderNumber();
  sequence_ = number < kFirstSequence ? nullptr : sequences_[number - kFirstSequence];
  const EntryMerger& merger = sequence_ != nullptr ? *sequence_ : all_;
  leader_ = &merger.leader();
  leaderNumber_ = merger.leaderNumber();
  header_ = &leader_->header();
  const EntryHeader* const inSequence = sequence_ != nullptr ? sequence_->rival() : nullptr;
  rivalNumber_ = inSequence != nullptr ? inSequence->sequenceNumber : UINT64_MAX;
  rival_ = all_.rival();
  leads_ = comesFirst();
  return true;
}

// A sequence gets its own merger only if it has several files. A file that may hold several
// sequences goes to all_ directly: numbers alone do not order its entries.
void StoreMerger::start() {
  for (auto& [sequence, streams] : std::exchange(waiting_, {})) {
    if (sequence != Id128{} && streams.size() > 1) {
      addSequence(streams);
    } else {
      for (auto& [stream, number] : streams) all_.add(std::move(stream), number);
    }
  }
}

void StoreMerger::addSequence(Streams& streams) {
  const auto number = kFirstSequence + static_cast<uint32_t>(sequences_.size());
  auto sequence = std::make_unique<EntryMerger>(stop_, duplicates_);
  for (auto& [stream, file] : streams) sequence->add(std::move(stream), file);
  sequences_.push_back(sequence.get());
  all_.add(std::move(sequence), number);
}

}  // namespace tessel
