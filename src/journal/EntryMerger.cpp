#include "journal/EntryMerger.h"

#include <algorithm>
#include <tuple>
#include <utility>

namespace tessel {

namespace {
constexpr Id128 kNoId{};
}

bool comesBefore(const EntryHeader& a, const EntryHeader& b) {
  if (sameId(a.sequenceId, b.sequenceId) && !sameId(a.sequenceId, kNoId) &&
      a.sequenceNumber != b.sequenceNumber)
    return a.sequenceNumber < b.sequenceNumber;
  if (sameId(a.bootId, b.bootId) && a.monotonic != b.monotonic) return a.monotonic < b.monotonic;
  return std::tie(a.realtime, a.contentHash, a.bootId, a.monotonic) <
         std::tie(b.realtime, b.contentHash, b.bootId, b.monotonic);
}

bool sameEntry(const EntryHeader& a, const EntryHeader& b) {
  return a.sequenceNumber == b.sequenceNumber && a.contentHash == b.contentHash &&
         a.realtime == b.realtime && a.monotonic == b.monotonic && sameId(a.bootId, b.bootId) &&
         sameId(a.sequenceId, b.sequenceId) && !sameId(a.sequenceId, kNoId) && a.contentHash != 0;
}

void EntryMerger::add(std::unique_ptr<EntryStream> stream, uint32_t number) {
  Source source{std::move(stream), nullptr, number, 0};
  if (source.next()) heap_.push_back(std::move(source));
}

bool EntryMerger::next() {
  if (started_ && !heap_.empty()) {
    dropDuplicates();
    advanceFirst();
  } else if (!started_) {
    started_ = true;
    for (size_t i = heap_.size() / 2; i-- > 0;) siftDown(i);
    runnerUp_ = findRunnerUp();
  }
  ++current_;
  return !heap_.empty() && !stop_.load(std::memory_order_relaxed);
}

// Most entries are followed by one of the same stream; then nothing moves.
void EntryMerger::advanceFirst() {
  const bool more = heap_.front().next();
  if (more && (runnerUp_ == 0 || !comesBefore(*heap_[runnerUp_].header, *heap_.front().header)))
      [[likely]]
    return;
  if (!more) close(0);
  siftDown(0);
  runnerUp_ = findRunnerUp();
}

void EntryMerger::close(size_t index) {
  std::swap(heap_[index], heap_.back());
  heap_.pop_back();
}

// The index of the stream that comes first but for the very first; 0: there is none.
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

// Skips the current entry, once, in all streams but its own. What equals the first of the heap can
// only be right below it, and what is below that comes up when it is skipped.
void EntryMerger::dropDuplicates() {
  for (size_t child = 1; child <= 2 && child < heap_.size();) {
    if (heap_[child].droppedAt == current_ ||
        !sameEntry(*heap_[child].header, *heap_.front().header)) [[likely]] {
      ++child;
      continue;
    }
    heap_[child].droppedAt = current_;
    ++duplicates_;
    if (!heap_[child].next()) close(child);
    siftDown(child);
    runnerUp_ = findRunnerUp();
  }
}

namespace {
constexpr uint32_t kFirstSequence = 0x80000000;
}

class StoreMerger::Sequence final : public EntryStream {
 public:
  Sequence(const StopFlag& stop, uint64_t& duplicates, Streams& streams)
      : merger_(stop, duplicates) {
    for (auto& [stream, number] : streams) merger_.add(std::move(stream), number);
  }

  bool next() override { return merger_.next(); }
  const EntryHeader& header() const override { return merger_.header(); }
  Entry entry() override { return merger_.entry(); }
  uint32_t streamNumber() const { return merger_.streamNumber(); }

 private:
  EntryMerger merger_;
};

void StoreMerger::add(std::unique_ptr<EntryStream> stream, uint32_t number, const Id128& sequence) {
  waiting_[sequence].emplace_back(std::move(stream), number);
}

bool StoreMerger::next() {
  if (!waiting_.empty()) start();
  return all_.next();
}

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
  auto sequence = std::make_unique<Sequence>(stop_, duplicates_, streams);
  sequences_.push_back(sequence.get());
  all_.add(std::move(sequence), number);
}

uint32_t StoreMerger::streamNumber() const {
  const uint32_t number = all_.streamNumber();
  return number < kFirstSequence ? number : sequences_[number - kFirstSequence]->streamNumber();
}

}  // namespace tessel
