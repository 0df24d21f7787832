// OpenIntervals keeps the begins that wait for their end.
//
// The begins lie in a slab. An index finds them by key, and a list links them by age. If there are
// too many, the oldest is dropped, because the longest overdue end is the least likely to come. A
// begin that replaces another becomes the youngest, because its own end is not overdue yet. The
// slab never shrinks: it has room for as many begins as were ever open at once.
//
// An interval keeps its tokens while other entries are read. When the table starts a new
// generation, renewAll() exchanges them.
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

// A begin and an end belong together if their keys are equal.
struct IntervalKey {
  // Takes the place of the process if begin and end may come from two processes. No token has this
  // value.
  static constexpr FieldToken kSystemScope = ~FieldToken{0};

  uint64_t id;  // TracePointTable::identity() of the id's token
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

// A writer that never ends its intervals must not use up our memory. No ordinary machine has 65,536
// intervals open at once; at 160 bytes a begin they take 10 MiB. An attribute is a token of 4
// bytes, so 262,144 attributes take 1 MiB. That is four attributes for each begin.
struct OpenIntervalLimits {
  size_t intervals = 65'536;
  size_t attributes = 262'144;  // of all open intervals together
};

class OpenIntervals {
 public:
  explicit OpenIntervals(OpenIntervalLimits limits = {});

  // Opens an interval. If one is open under the same key, replaces it and answers true.
  bool open(const IntervalKey& key, uint64_t monotonic, const PointTokens& tokens,
            const std::vector<FieldToken>& attributes);
  // The open interval under `key`, or null; valid until the next call that is not const.
  const OpenInterval* find(const IntervalKey& key) const;
  // REQUIRES: `interval` was answered by find().
  void close(const OpenInterval* interval);

  // Calls `renew` on each interval, from the youngest to the oldest. `renew` may change the key.
  // When it first answers false, that interval and all older ones are dropped.
  void renewAll(const std::function<bool(OpenInterval&)>& renew);

  size_t size() const { return size_; }
  // The number of begins dropped by the limits or by renewAll().
  uint64_t dropped() const { return dropped_; }

 private:
  static constexpr uint32_t kNone = FlatIndex::kNone;
  struct Node : OpenInterval {
    uint32_t hash = 0;       // of the key
    uint32_t older = kNone;  // in a free node: the next free node
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
  size_t size_ = 0;  // nodes in the list by age
  size_t attributes_ = 0;
  uint64_t dropped_ = 0;
};

}  // namespace tessel
