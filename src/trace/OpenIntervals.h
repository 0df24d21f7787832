// OpenIntervals: the begins that wait for their end.
//
// The begins stand in a slab, an index finds them by their key, and a list links them by age: over
// the limits the oldest goes, because the end that is longest overdue is the least likely to come.
// A begin that replaces another counts as the youngest, for the same reason: its end is due from
// now on. The memory is that of as many begins as were ever open at once.
//
// Intervals hold tokens, from one entry to the next and over a change of generation: see
// renewAll().
//
// Threads: one at a time.

#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/FlatIndex.h"
#include "trace/TracePointFields.h"

namespace tessel {

using PointTokens = std::array<FieldToken, kPointSlots>;

// A begin and an end belong together where these are equal.
struct IntervalKey {
  // Stands for the process of an interval whose ends may come from two. No token has this value.
  static constexpr FieldToken kSystemScope = ~FieldToken{0};

  uint64_t id;  // TracePointTable::identity() of its token
  FieldToken boot;
  FieldToken subsystem;
  FieldToken category;
  FieldToken name;
  FieldToken process;  // or kSystemScope

  bool operator==(const IntervalKey&) const = default;
};

struct OpenInterval {
  IntervalKey key{};
  uint64_t monotonic = 0;  // of the begin, microseconds since boot
  PointTokens tokens{};
  std::vector<FieldToken> attributes;
};

// A writer that begins intervals and never ends them must not take our memory. 65,536 begins of 160
// bytes are 10 MiB, far more than a machine has under way at once. An attribute is a token of 4
// bytes, so 262,144 of them are 1 MiB: room for four on each of that many begins.
struct OpenIntervalLimits {
  size_t intervals = 65'536;
  size_t attributes = 262'144;  // of all open intervals together
};

class OpenIntervals {
 public:
  explicit OpenIntervals(OpenIntervalLimits limits = {});

  // Opens an interval. Answers whether one was open under the same key, which it replaces.
  bool open(const IntervalKey& key, uint64_t monotonic, const PointTokens& tokens,
            const std::vector<FieldToken>& attributes);
  // The open interval under `key`, or null; valid until the next call that is not const.
  const OpenInterval* find(const IntervalKey& key) const;
  // REQUIRES: `interval` was answered by find().
  void close(const OpenInterval* interval);

  // Calls `renew`, which may change the key, on each interval from the youngest to the oldest. The
  // first for which it answers false is dropped, and so are all that are older.
  void renewAll(const std::function<bool(OpenInterval&)>& renew);

  size_t size() const { return size_; }
  // How many were dropped because of the limits, or because they found no room when renewed.
  uint64_t dropped() const { return dropped_; }

 private:
  static constexpr uint32_t kNone = FlatIndex::kNone;
  struct Node : OpenInterval {
    uint32_t hash = 0;       // of the key
    uint32_t older = kNone;  // of a free node: the next free one
    uint32_t younger = kNone;
  };

  uint32_t numberOf(const IntervalKey& key, uint32_t hash) const;
  uint32_t newNode();
  void link(uint32_t number);
  void remove(uint32_t number);
  void release(uint32_t number);

  const OpenIntervalLimits limits_;
  std::vector<Node> nodes_;
  FlatIndex index_;  // of nodes_, by the key
  uint32_t free_ = kNone;
  uint32_t oldest_ = kNone;
  uint32_t youngest_ = kNone;
  size_t size_ = 0;  // of the list by age
  size_t attributes_ = 0;
  uint64_t dropped_ = 0;
};

}  // namespace tessel
