#include "journal/StoreMerger.h"

namespace tessel {

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
