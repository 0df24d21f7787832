// Finding the counter that an entry tells of, and adding up what it grew by.

#include "trace/SourceLosses.h"

#include <algorithm>
#include <array>
#include <cstring>

#include "platform/Invariant.h"

namespace tessel {

uint32_t SourceLosses::hashOf(const Counter& counter) {
  std::array<uint64_t, 2> boot;
  static_assert(sizeof boot == sizeof counter.boot);
  std::memcpy(boot.data(), counter.boot.data(), sizeof boot);
  return hashWords(boot[0], boot[1], counter.process, counter.since);
}

uint32_t SourceLosses::find(const Counter& wanted) const {
  return index_.find(hashOf(wanted), [&](uint32_t number) {
    const Counter& counter = counters_[number];
    return counter.boot == wanted.boot && counter.process == wanted.process &&
           counter.since == wanted.since;
  });
}

SourceLosses::Counter& SourceLosses::add(const Counter& fresh) {
  index_.add(hashOf(fresh), static_cast<uint32_t>(counters_.size()));
  counters_.push_back(fresh);
  // Each counter is a share of its writer, or the only one for all his others.
  TESSEL_INVARIANT(counters_.size() <= kMaxCounters + writers_.size());
  return counters_.back();
}

// Without a time only the writer tells apart two processes that had one number. Otherwise a user
// could wait for the number of another's process, and add to what that one told.
uint64_t SourceLosses::standInOf(const Origin& writer) {
  constexpr uint64_t kOdd = 0x9e3779b97f4a7c15u;  // spreads the users over all bits
  return writer.image.hash() ^ (writer.user ? *writer.user + uint64_t{1} : 0) * kOdd;
}

// The writer is no part of what tells dated counters apart: the last entry of a process is often
// read when the process has gone, and then nobody knows its executable. It counts for the writer of
// the entry before.
SourceLosses::Counter& SourceLosses::counterOf(const ToldLosses& told) {
  const bool dated = told.since != 0;
  Counter wanted{told.boot, told.process, dated ? told.since : standInOf(told.writer), 0, 0, dated};
  uint32_t known = find(wanted);
  if (known != FlatIndex::kNone) return counters_[known];
  wanted.writer = writers_.numberOf(told.writer);
  if (!admits_(told.writer)) {
    wanted = {{}, kAllOthers, wanted.writer, 0, wanted.writer, true};
    known = find(wanted);
    if (known != FlatIndex::kNone) return counters_[known];
  }
  return add(wanted);
}

void SourceLosses::add(const ToldLosses& told) {
  const uint64_t total = std::min(told.total, kMostOfACounter);
  if (total == 0) return;
  Counter& counter = counterOf(told);
  const bool earlier = told.since != 0 && told.since < rangeStart_;
  if (counter.total == 0 && earlier) {
    writers_.lost(counter.writer, LossCode::lostEarlier, total);
  } else if (total > counter.total) {
    writers_.lost(counter.writer, LossCode::lostAtSource, total - counter.total);
  } else if (total < counter.total && !counter.dated) {
    // A total never falls, so this is another process under the number of the first.
    writers_.lost(counter.writer, LossCode::lostAtSource, total);
  } else {
    return;  // told before, or by a thread that was overtaken
  }
  counter.total = total;
}

}  // namespace tessel
