// Merging: many entry streams as one, in the journal's own order, each entry once.
//
// A daemon numbers its entries in a row, a sequence, which goes on from file to file. Which of two
// entries comes first? If they belong to one sequence, the lower number comes first; the daemon
// gave the numbers, so this is always right. Otherwise, if both are of one boot, the monotonic
// clock decides. Otherwise the wall clock decides.
//
// These rules can contradict each other. If the clock was set back between A and B, A comes before
// B by number; but an entry C of another sequence can come after B and before A by the clock. A
// merge of all files at once would still deliver every entry. But a store may hold a file and a
// copy of it. The two copies of an entry could then come up far apart, and the merge would not see
// that they are equal.
//
// Therefore StoreMerger works in two steps. First it merges the files of each sequence: there the
// numbers alone decide, and copies always meet. Then it merges the sequences. The price is one more
// comparison for each entry. We could also find the copies if we remembered every entry, but that
// takes memory without bound.
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

// Whether `a` comes before `b`, by the clocks alone.
bool comesBeforeByTime(const EntryHeader& a, const EntryHeader& b);
// Whether `a` comes before `b`.
inline bool comesBefore(const EntryHeader& a, const EntryHeader& b) {
  if (sameId(a.sequenceId, b.sequenceId) && a.sequenceNumber != b.sequenceNumber &&
      !sameId(a.sequenceId, Id128{})) [[likely]]
    return a.sequenceNumber < b.sequenceNumber;
  return comesBeforeByTime(a, b);
}
// Whether both are copies of one entry. False if one has no sequence or no hash: then we cannot
// tell two copies from two different entries, and delivering an entry twice loses nothing. The
// number differs nearly always, so it is compared first and the ids last.
inline bool sameEntry(const EntryHeader& a, const EntryHeader& b) {
  return a.sequenceNumber == b.sequenceNumber && a.contentHash == b.contentHash &&
         a.realtime == b.realtime && a.monotonic == b.monotonic && sameId(a.bootId, b.bootId) &&
         sameId(a.sequenceId, b.sequenceId) && !sameId(a.sequenceId, Id128{}) && a.contentHash != 0;
}

// Merges streams with a heap. It delivers an entry of several streams once, unless the rules above
// contradict each other for these streams. If one stream has equal entries, it delivers them all:
// they were written more than once.
class EntryMerger final : public EntryStream {
 public:
  // Adds to `duplicates` each copy that it leaves out. `stop` and `duplicates` must outlive the
  // merger.
  EntryMerger(const StopFlag& stop, uint64_t& duplicates) : stop_(stop), duplicates_(duplicates) {}

  // Adds a stream and asks it for its first entry at once. The merger destroys a stream after its
  // last entry: that closes the file and leaves more of the window budget to the others. REQUIRES:
  // next() was not called.
  void add(std::unique_ptr<EntryStream> stream, uint32_t number);

  bool next() override;
  const EntryHeader& header() const override { return *heap_.front().header; }
  std::span<const FieldToken> tokens() override { return heap_.front().stream->tokens(); }
  // The stream of the current entry, and its number. REQUIRES: next() answered true.
  EntryStream& leader() const { return *heap_.front().stream; }
  uint32_t leaderNumber() const { return heap_.front().number; }
  // The entry that comes next of the other streams; null if there are none.
  const EntryHeader* rival() const { return runnerUp_ == 0 ? nullptr : heap_[runnerUp_].header; }
  // Takes the place of next() if the caller moved the leader by himself. `more`: what its next()
  // answered. REQUIRES: no other stream had a copy of the current entry.
  bool leaderMoved(bool more);

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

  void start();
  void close(size_t index);
  size_t findRunnerUp() const;
  void siftDown(size_t index);
  void dropDuplicates();
  bool skipCopy(size_t child);

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

  // Adds a stream whose entries all belong to `sequence`. If `sequence` is all zero, they may
  // belong to any sequences or to none. REQUIRES: next() was not called; header() of the stream
  // answers the same reference for each entry.
  void add(std::unique_ptr<EntryStream> stream, uint32_t number, const Id128& sequence);

  bool next() override {
    // Files follow one another in time, so one of them mostly leads for long. As long as its
    // entries come before those of all others, no heap has to move, and none of them has a copy.
    if (leads_) [[likely]] {
      const bool more = leader_->next();
      if (more && comesFirst()) [[likely]]
        return true;
      return settle(more);
    }
    return nextOfAll();
  }
  const EntryHeader& header() const override { return *header_; }
  std::span<const FieldToken> tokens() override { return leader_->tokens(); }
  // Number of the stream that the current entry is from. REQUIRES: next() answered true.
  uint32_t streamNumber() const { return leaderNumber_; }
  // How many copies of entries it left out so far.
  uint64_t duplicates() const { return duplicates_; }

 private:
  using Streams = std::vector<std::pair<std::unique_ptr<EntryStream>, uint32_t>>;

  void start();
  void addSequence(Streams& streams);
  // Whether the current entry comes before those of all other streams. Not if it is equal to one.
  bool comesFirst() const {
    return header_->sequenceNumber < rivalNumber_ &&
           (rival_ == nullptr || comesBefore(*header_, *rival_));
  }
  bool nextOfAll();
  bool settle(bool more);
  bool findLeader(bool more);

  const StopFlag& stop_;
  uint64_t duplicates_ = 0;
  std::map<Id128, Streams> waiting_;  // by sequence, until the first entry is asked for
  // In all_, sequence i has the number kFirstSequence + i; all_ owns it.
  std::vector<EntryMerger*> sequences_;
  EntryMerger all_;
  // Of the current entry: its file, the merger of its sequence or null, and what comes next of the
  // others: the number of that entry in the other files of the sequence, or no number if there is
  // none; and the entry of all other files, or null. In a sequence the number alone decides.
  EntryStream* leader_ = nullptr;
  uint32_t leaderNumber_ = 0;
  const EntryHeader* header_ = nullptr;
  EntryMerger* sequence_ = nullptr;
  uint64_t rivalNumber_ = UINT64_MAX;
  const EntryHeader* rival_ = nullptr;
  bool leads_ = false;  // the current entry comes before those of all other streams
};

}  // namespace tessel
