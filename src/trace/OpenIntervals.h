// OpenIntervals keeps the begins that wait for their end.
//
// The begins lie in a slab. An index finds them by key, and a list for each writer links his begins
// by age. While there is room, everyone may have as many as he likes. If there are too many, the
// writer who holds most loses his oldest begin: whoever floods us pays for it himself, and the
// longest overdue end is the least likely to come. A begin that replaces another becomes the
// youngest, because its own end is not overdue yet. The slab never shrinks: it has room for as many
// begins as were ever open at once.
//
// An interval keeps its tokens while other entries are read. When the table starts a new
// generation, renewAll() exchanges them. The new generation may have too little room for all their
// text. Those who hold least are then served first.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <optional>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/FlatIndex.h"
#include "trace/TracePointFields.h"
#include "trace/Writers.h"

namespace tessel {

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
// intervals open at once; at 176 bytes a begin they take 11 MiB. An attribute is a token of 4
// bytes, so 262,144 attributes take 1 MiB. That is four attributes for each begin.
struct OpenIntervalLimits {
  size_t intervals = 65'536;
  size_t attributes = 262'144;  // of all open intervals together
};

class OpenIntervals {
 public:
  // Drops are noted as losses of their writers. REQUIRES: `writers` outlives this object.
  explicit OpenIntervals(Writers& writers, OpenIntervalLimits limits = {});

  struct Opened {
    uint32_t place;  // of the interval, until it is closed, replaced or dropped
    bool replaced;   // one was open under the same key
  };
  // Opens an interval of `writer`. It replaces the one that is open under the same key.
  Opened open(const IntervalKey& key, uint32_t writer, uint64_t monotonic,
              const PointTokens& tokens, const std::vector<FieldToken>& attributes);
  // The open interval under `key`, or null; valid until the next call that is not const. `place`
  // may be any number. If the interval stands there, no search is needed. A search looks at a line
  // of the index that was not touched for long: that took as long as all else of an end.
  const OpenInterval* find(const IntervalKey& key, uint32_t place = FlatIndex::kNone) const {
    if (place < nodes_.size() && nodes_[place].isOpen && nodes_[place].key == key) [[likely]]
      return &nodes_[place];
    return search(key);
  }
  // REQUIRES: `interval` was answered by find().
  void close(const OpenInterval* interval);

  // Calls `renew` on the intervals, each time on the youngest one left of the writer whose
  // intervals took the least so far. `renew` may change the key, and answers how much room the
  // interval takes now. When it first answers nothing, that interval and all that are left are
  // dropped.
  void renewAll(const std::function<std::optional<size_t>(OpenInterval&)>& renew);

  size_t size() const { return intervals_.total(); }
  void forEach(const std::function<void(const OpenInterval&)>& visit) const {
    for (const Node& node : nodes_)
      if (node.isOpen) visit(node);
  }

 private:
  static constexpr uint32_t kNone = FlatIndex::kNone;
  struct Node : OpenInterval {
    bool isOpen = false;
    uint32_t hash = 0;  // of the key
    uint32_t writer = 0;
    uint32_t older = kNone;  // of the same writer; in a free node: the next free node
    uint32_t younger = kNone;
  };
  struct Ends {
    uint32_t oldest = kNone;
    uint32_t youngest = kNone;
  };

  const OpenInterval* search(const IntervalKey& key) const;
  uint32_t numberOf(const IntervalKey& key, uint32_t hash) const;
  uint32_t newNode();
  void link(uint32_t number);
  void remove(uint32_t number);
  void release(uint32_t number);
  void drop(uint32_t number);

  Writers& writers_;
  const OpenIntervalLimits limits_;
  std::vector<Node> nodes_;
  FlatIndex index_;         // of nodes_, by the key
  std::vector<Ends> ends_;  // by writer
  Holdings intervals_;
  Holdings attributes_;
  uint32_t free_ = kNone;
};

}  // namespace tessel
