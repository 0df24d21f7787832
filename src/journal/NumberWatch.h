// NumberWatch: which numbers no entry has.
//
// A daemon numbers the entries of a machine in a row, whichever of its files it writes them to. A
// user's file has a sequence id of its own, yet shares the counter. So only the entries of all
// files together show whether numbers are missing. We look at each boot by itself, because the
// counter may begin anew with it.
//
// Only numbers between two entries of the period count. An entry of another time may stand between
// them, since a writer of export files can give it any time: it has its number, and none is
// missing.
//
// A missing number alone is no loss of ours: the daemon removes old files, and a user's sooner than
// its own. It tells how much was lost where something else tells that there is a loss.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <cstdint>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel {

class NumberWatch {
 public:
  // `counter` is equal for all files whose entries one daemon numbers. Entries come in their order,
  // but those of several files may change places with their neighbours. `inPeriod` is false for
  // entries of another time.
  void see(uint32_t counter, const EntryHeader& entry, bool inPeriod) {
    if (last_ == nullptr || last_->counter != counter || !sameId(last_->boot, entry.bootId))
        [[unlikely]] {
      if (!find(counter, entry, inPeriod)) return;
    }
    Row& row = *last_;
    if (entry.sequenceNumber == row.number + 1) [[likely]] {
      row.number = entry.sequenceNumber;
    } else if (entry.sequenceNumber != 0) {
      advance(row, entry.sequenceNumber);
    }
    if (inPeriod && entry.sequenceNumber > row.lastOfPeriod)
      row.lastOfPeriod = entry.sequenceNumber;
  }
  uint64_t gaps() const {
    uint64_t gaps = 0;
    for (const Row& row : rows_)
      for (const Gap& gap : row.gaps) gaps += gap.last < row.lastOfPeriod ? 1 : 0;
    return gaps;
  }
  uint64_t missing() const {
    uint64_t missing = 0;
    for (const Row& row : rows_)
      for (const Gap& gap : row.gaps)
        missing += gap.last < row.lastOfPeriod ? gap.last - gap.first + 1 : 0;
    return missing;
  }

 private:
  // A day has few boots. A store that was made to have thousands, or thousands of gaps, would cost
  // time and memory. What goes beyond these bounds is not watched.
  static constexpr size_t kMaxRows = 1024;
  static constexpr size_t kMaxGaps = 1024;
  // A number so far ahead may be damaged. It is, if a later entry goes back behind it: neighbours
  // change places only within a moment, and no daemon writes so much in one.
  static constexpr uint64_t kFarAhead = 4096;

  struct Gap {
    uint64_t first;
    uint64_t last;
  };
  struct Row {
    uint32_t counter;
    Id128 boot;
    uint64_t number;        // the greatest so far
    std::vector<Gap> gaps;  // numbers below it that did not come yet, rising
    uint64_t lastOfPeriod = 0;
  };

  [[gnu::noinline]] bool find(uint32_t counter, const EntryHeader& entry, bool inPeriod) {
    if (entry.sequenceNumber == 0) return false;
    const auto known = std::find_if(rows_.begin(), rows_.end(), [&](const Row& row) {
      return row.counter == counter && row.boot == entry.bootId;
    });
    if (known == rows_.end() && (!inPeriod || rows_.size() == kMaxRows)) return false;
    last_ = known != rows_.end()
                ? &*known
                : &rows_.emplace_back(Row{counter, entry.bootId, entry.sequenceNumber, {}, 0});
    return true;
  }

  [[gnu::noinline]] static void advance(Row& row, uint64_t number) {
    if (number > row.number) {
      if (row.gaps.size() < kMaxGaps) row.gaps.push_back({row.number + 1, number - 1});
      row.number = number;
      return;
    }
    const auto gap = std::lower_bound(row.gaps.begin(), row.gaps.end(), number,
                                      [](const Gap& a, uint64_t b) { return a.last < b; });
    if (gap == row.gaps.end() || number < gap->first) return;
    const Gap before{gap->first, number - 1};
    const Gap behind{number + 1, gap->last};
    const bool wrong = gap + 1 == row.gaps.end() && behind.last == row.number - 1 &&
                       gap->last - gap->first >= kFarAhead;
    if (wrong) row.number = number;
    const auto at = row.gaps.erase(gap);
    const auto next = behind.first > behind.last || wrong ? at : row.gaps.insert(at, behind);
    if (before.first <= before.last) row.gaps.insert(next, before);
  }

  std::vector<Row> rows_;
  Row* last_ = nullptr;  // of the last entry; find() sets it anew when it adds a row
};

}  // namespace tessel
