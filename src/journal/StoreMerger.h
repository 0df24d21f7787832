// StoreMerger: the files of a store as one stream, in the journal's own order.
//
// The order between files of several sequences may run in a circle, where a clock was set or boots
// overlap: what is met twice could then lie far apart. So the files of one sequence, whose order is
// never in doubt, are merged first, and an entry that stands in several of them is left out there.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <utility>
#include <vector>

#include "journal/EntryMerger.h"
#include "journal/EntryStream.h"

namespace tessel {

class StoreMerger final : public EntryStream {
 public:
  // `stop` must outlive the merger.
  explicit StoreMerger(const StopFlag& stop) : stop_(stop), all_(stop, duplicates_) {}

  // Adds a stream whose entries all count in `sequence`; all zero: in none, or in several.
  // REQUIRES: next() was not called.
  void add(std::unique_ptr<EntryStream> stream, uint32_t number, const Id128& sequence);

  bool next() override;
  const EntryHeader& header() const override { return all_.header(); }
  Entry entry() override { return all_.entry(); }
  // Number of the stream that the current entry is from. REQUIRES: next() answered true.
  uint32_t streamNumber() const;
  // Entries left out as they stand in another stream as well.
  uint64_t duplicates() const { return duplicates_; }

 private:
  using Streams = std::vector<std::pair<std::unique_ptr<EntryStream>, uint32_t>>;
  class Sequence;

  void start();
  void addSequence(Streams& streams);

  const StopFlag& stop_;
  uint64_t duplicates_ = 0;
  std::map<Id128, Streams> waiting_;  // until the first entry is asked for
  // Owned by all_, which knows one by the number that is its place here, behind those of streams.
  std::vector<const Sequence*> sequences_;
  EntryMerger all_;
};

}  // namespace tessel
