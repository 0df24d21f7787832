// EntryMerger: many entry streams as one, in the journal's own order.
//
// Of two entries, the one with the lower number comes first where both count in the same sequence,
// else the earlier by the monotonic clock where both are of one boot, else the earlier by the wall
// clock. An entry that stands in several streams is delivered once, where that order does not run
// in a circle; equal entries of one stream are all delivered.
//
// Threads: one at a time, but for the stop flag.
//
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
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel {

// Whether `a` comes before `b`.
bool comesBefore(const EntryHeader& a, const EntryHeader& b);
// Whether both are the same entry, found in two places. An entry of no sequence, or without a hash,
// is the same as none.
bool sameEntry(const EntryHeader& a, const EntryHeader& b);

class EntryMerger final : public EntryStream {
 public:
  // Adds to `duplicates` the entries that it leaves out as they stand in another stream as well.
  // Both must outlive the merger.
  EntryMerger(const StopFlag& stop, uint64_t& duplicates) : stop_(stop), duplicates_(duplicates) {}

  // Adds a stream; it is asked for its first entry at once, and closed after its last.
  // REQUIRES: next() was not called.
  void add(std::unique_ptr<EntryStream> stream, uint32_t number);

  bool next() override;
  const EntryHeader& header() const override { return *heap_.front().header; }
  Entry entry() override { return heap_.front().stream->entry(); }
  // Number of the stream that the current entry is from. REQUIRES: next() answered true.
  uint32_t streamNumber() const { return heap_.front().number; }

 private:
  struct Source {
    bool next() {
      if (!stream->next()) return false;
      header = &stream->header();
      return true;
    }

    std::unique_ptr<EntryStream> stream;
    const EntryHeader* header;  // of its current entry
    uint32_t number;
    uint64_t droppedAt = 0;  // of the current entries, by count, the last that it lost a twin of
  };

  void advanceFirst();
  void close(size_t index);
  size_t findRunnerUp() const;
  void siftDown(size_t index);
  void dropDuplicates();

  const StopFlag& stop_;
  uint64_t& duplicates_;
  std::vector<Source> heap_;
  size_t runnerUp_ = 0;
  bool started_ = false;
  uint64_t current_ = 0;  // entries delivered, the current one included
};

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
