// SourceLosses: the trace points that programs could not hand to the journal, by what they tell.
//
// A recorder counts what the journal's socket does not take, and its later entries carry the total:
// TESSEL_LOST, and in TESSEL_LOST_SINCE the moment of the first loss. A total is told again and
// again and grows, so of each counter only the growth counts. A counter is a process with a moment:
// the number of a process is used again, and a program with a library may have two counters.
//
// A counter that began within the period counts with all that it tells. One that began earlier
// counts with what it grows by from its first entry in the period on; nobody can say how much of
// its first total was lost before the period, so that is told apart, as "lost earlier".
//
// Anyone can write such entries, with any number in them. So counters are shared out among the
// writers like pairs. Those of a writer beyond his share count as one, whose greatest total counts:
// then his losses are at least that many. One counter tells at most what the field can, so no sum
// overflows.
//
// Threads: one at a time.

#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/FlatIndex.h"
#include "trace/Writers.h"

namespace tessel {

// What one entry tells.
struct ToldLosses {
  Origin writer;
  Id128 boot{};
  uint32_t process = 0;  // 0: the entry names none
  uint64_t since = 0;    // microseconds since 1970; 0: the entry does not say
  uint64_t total = 0;
};

class SourceLosses {
 public:
  // 32,768 counters of 48 bytes take 1.5 MiB. A machine has fewer processes in a day that lose
  // something.
  static constexpr size_t kMaxCounters = 32768;
  // The recorders' counters stop here. We take a greater total for this one.
  static constexpr uint64_t kMostOfACounter = (uint64_t{1} << 42) - 1;

  // `admits` says whether a writer may have one more counter. REQUIRES: `writers` outlives this.
  SourceLosses(Writers& writers, std::function<bool(const Origin&)> admits)
      : writers_(writers), admits_(std::move(admits)) {}

  // The start of the period, in microseconds since 1970. Without it all losses are of the period.
  void startAt(uint64_t rangeStart) { rangeStart_ = rangeStart; }
  // Adds to the losses of the counter's writer what is new.
  void add(const ToldLosses& told);

 private:
  struct Counter {
    Id128 boot;
    uint64_t process;
    uint64_t since;  // if the entry does not say: standInOf() its writer
    uint64_t total;  // the greatest so far
    uint32_t writer;
    bool dated;  // whether `since` is a time
  };
  // Beyond his share a writer has one counter, with this in the place of the process.
  static constexpr uint64_t kAllOthers = uint64_t{1} << 63;

  Counter& counterOf(const ToldLosses& told);
  static uint64_t standInOf(const Origin& writer);
  uint32_t find(const Counter& wanted) const;
  Counter& add(const Counter& fresh);
  static uint32_t hashOf(const Counter& counter);

  Writers& writers_;
  std::function<bool(const Origin&)> admits_;
  uint64_t rangeStart_ = 0;
  std::vector<Counter> counters_;
  FlatIndex index_;
};

}  // namespace tessel
