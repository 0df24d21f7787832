// Merging: many entry streams as one, in the journal's own order, each entry once.
//
// Which of two entries comes first? If both count in the same sequence, the one with the lower
// number: the daemon gave the numbers, so this is always right. Otherwise, if both are of one boot,
// the earlier one by the monotonic clock. Otherwise the earlier one by the wall clock.
//
// Taken together these rules are no order. With one entry of another sequence between two numbers,
// and a clock that was set back, A can come before B, B before C, and C before A. A merge then
// still delivers every entry, but copies of one entry, which stand in an archived file and in a
// copy of it, may come up far apart, so that the merge does not see that they are equal. Therefore
// StoreMerger first merges the files of each sequence, where numbers alone decide and copies always
// meet, and only then the sequences. The price is one comparison more for each entry. Remembering
// every entry that was delivered would also find the copies, but takes memory without bound.
//
// Threads: one at a time, except for the stop flag.

#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel {

// Whether `a` comes before `b`.
bool comesBefore(const EntryHeader& a, const EntryHeader& b);
// Whether both are copies of one entry. An entry without a sequence or a hash has no copies: two
// like it cannot be told from two different entries, and showing one twice loses nothing.
bool sameEntry(const EntryHeader& a, const EntryHeader& b);

// Merges streams with a heap. An entry that stands in several streams is delivered once, as long as
// the order of these streams does not run in a circle. Equal entries of one stream are all
// delivered, because they are entries that were written twice.
class EntryMerger final : public EntryStream {
 public:
  // Counts in `duplicates` the copies that it leaves out. Both must outlive the merger.
  EntryMerger(const StopFlag& stop, uint64_t& duplicates) : stop_(stop), duplicates_(duplicates) {}

  // Adds a stream. It is asked for its first entry at once and destroyed after its last, which
  // closes its file and leaves more of the window budget to the others.
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
    // The value of current_ when we last skipped an entry of this stream as a copy.
    uint64_t skippedFor = 0;
  };

  void advanceFirst();
  void close(size_t index);
  size_t findRunnerUp() const;
  void siftDown(size_t index);
  void dropDuplicates();

  const StopFlag& stop_;
  uint64_t& duplicates_;
  std::vector<Source> heap_;  // the stream with the entry that comes first is at the front
  size_t runnerUp_ = 0;       // index of the stream that comes second; 0: there is none
  bool started_ = false;
  uint64_t current_ = 0;  // number of calls of next()
};

// Merges all streams of a store: first those of each sequence, then the results.
class StoreMerger final : public EntryStream {
 public:
  // `stop` must outlive the merger.
  explicit StoreMerger(const StopFlag& stop) : stop_(stop), all_(stop, duplicates_) {}

  // Adds a stream whose entries all count in `sequence`. All zero: they may count in any.
  // REQUIRES: next() was not called.
  void add(std::unique_ptr<EntryStream> stream, uint32_t number, const Id128& sequence);

  bool next() override;
  const EntryHeader& header() const override { return all_.header(); }
  Entry entry() override { return all_.entry(); }
  // Number of the stream that the current entry is from. REQUIRES: next() answered true.
  uint32_t streamNumber() const;
  // How many copies of entries were left out.
  uint64_t duplicates() const { return duplicates_; }

 private:
  using Streams = std::vector<std::pair<std::unique_ptr<EntryStream>, uint32_t>>;

  void start();
  void addSequence(Streams& streams);

  const StopFlag& stop_;
  uint64_t duplicates_ = 0;
  std::map<Id128, Streams> waiting_;  // by sequence, until the first entry is asked for
  // In all_, sequence i has the number kFirstSequence + i; all_ owns it.
  std::vector<const EntryMerger*> sequences_;
  EntryMerger all_;
};

}  // namespace tessel
