// OpenIntervals: the begins that wait for their end.
//
// A hash table on small integers over a slab of begins, which also stand in a list by age: over
// the limits the oldest goes. What the table takes is memory for as many begins as were ever open
// at once.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <vector>

#include "journal/EntryStream.h"
#include "trace/TracePointFields.h"

namespace tessel {

using PointTokens = std::array<FieldToken, kPointSlots>;

// What begin and end match on. `process` is the process's token, or kSystemScope.
struct IntervalKey {
  static constexpr FieldToken kSystemScope = ~FieldToken{0};

  uint64_t id;  // TracePointTable::identity() of its token
  FieldToken boot;
  FieldToken subsystem;
  FieldToken category;
  FieldToken name;
  FieldToken process;

  bool operator==(const IntervalKey&) const = default;
};

struct OpenInterval {
  IntervalKey key{};
  uint64_t monotonic = 0;  // of the begin, microseconds since boot
  PointTokens tokens{};
  std::vector<FieldToken> attributes;
};

struct OpenIntervalLimits {
  size_t intervals = 65'536;
  size_t attributes = 262'144;  // of all open intervals together
};

class OpenIntervals {
 public:
  explicit OpenIntervals(OpenIntervalLimits limits = {});

  // Opens an interval; one that is open under the same key is replaced and counts as the youngest.
  void open(const IntervalKey& key, uint64_t monotonic, const PointTokens& tokens,
            const std::vector<FieldToken>& attributes);
  // The open interval under `key`, or null; valid until the next call that is not const.
  const OpenInterval* find(const IntervalKey& key) const;
  // REQUIRES: `interval` was answered by find().
  void close(const OpenInterval* interval);

  // Calls `renew(OpenInterval&)`, which may change the key, on each from the youngest to the
  // oldest; from the first that answers false on, they are dropped.
  template <typename Renew>
  void renewAll(Renew&& renew);

  size_t size() const { return size_; }
  // How many gave way to younger ones.
  uint64_t dropped() const { return dropped_; }

 private:
  static constexpr uint32_t kNone = ~uint32_t{0};
  struct Node {
    OpenInterval interval;
    uint32_t hash = 0;
    uint32_t older = kNone;
    uint32_t younger = kNone;
  };
  struct Slot {
    uint32_t hash = 0;
    uint32_t node = kNone;
  };

  uint32_t hashOf(const IntervalKey& key) const;
  size_t slotOf(const IntervalKey& key, uint32_t hash) const;
  uint32_t newNode();
  void insertSlot(uint32_t node);
  void eraseSlot(size_t at);
  void grow();
  void link(uint32_t node);
  void remove(uint32_t node);
  void removeAt(size_t slot);
  void dropFrom(uint32_t node);
  void rehash();

  const OpenIntervalLimits limits_;
  const uint64_t seed_;
  std::vector<Node> nodes_;
  std::vector<uint32_t> free_;
  std::vector<Slot> slots_;
  uint32_t oldest_ = kNone;
  uint32_t youngest_ = kNone;
  size_t size_ = 0;
  size_t attributes_ = 0;
  uint64_t dropped_ = 0;
};

template <typename Renew>
void OpenIntervals::renewAll(Renew&& renew) {
  for (uint32_t at = youngest_; at != kNone; at = nodes_[at].older) {
    if (renew(nodes_[at].interval)) continue;
    dropFrom(at);
    break;
  }
  rehash();
}

}  // namespace tessel
