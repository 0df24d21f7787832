// TesselReporterAggregation: how many trace objects each (subsystem, category) pair contributed.
//
// A pair is counted without copying or hashing its texts: the key takes a share of the strings it
// is given when the pair is new, and nothing after that. At most 40 bytes per distinct pair.
//
// Threads: one at a time. Keys handed out are valid while the aggregation lives.

#pragma once

#include <cstdint>
#include <deque>
#include <string>
#include <utility>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/SharedString.h"

namespace tessel {

class TesselReporterAggregationKey {
 public:
  TesselReporterAggregationKey(SharedString subsystem, SharedString category)
      : subsystem_(std::move(subsystem)), category_(std::move(category)) {}

  const SharedString& subsystem() const { return subsystem_; }
  const SharedString& category() const { return category_; }

  // Equal keys have equal hashes; an absent string contributes 0.
  uint64_t hash() const { return subsystem_.hash() ^ category_.hash(); }
  // True for the very same key, and where all four strings are present and pairwise equal: a key
  // with an absent string equals itself alone, not even its copies.
  bool isEqual(const TesselReporterAggregationKey& other) const;
  // "subsystem/category"; an absent string reads "(null)".
  std::string description() const;

 private:
  SharedString subsystem_;
  SharedString category_;
};

class TesselReporterAggregation {
 public:
  using Key = TesselReporterAggregationKey;
  struct Entry {
    Key key;
    uint64_t count;
  };

  TesselReporterAggregation() = default;
  TesselReporterAggregation(const TesselReporterAggregation&) = delete;
  TesselReporterAggregation& operator=(const TesselReporterAggregation&) = delete;

  // Counts one object. A pair with an absent string equals no key, so each one is a new entry.
  void incrementSubsystem(StringRef subsystem, StringRef category);

  // The pair's count; 0 where it has none, and for a pair with an absent string.
  uint64_t countForSubsystem(StringRef subsystem, StringRef category) const;
  // The count stored under a key that equals `key`; 0 where there is none. A key with an absent
  // string has its count where it is one of this aggregation's own.
  uint64_t countForKey(const Key& key) const;
  // Every key once, larger counts first; equal counts in the order in which they first appeared.
  std::vector<const Key*> keysInDescendingCountOrder() const;

  // The sum of all counts.
  uint64_t totalCount() const { return totalCount_; }
  // One entry per distinct key, in the order in which they first appeared. Counts are at least 1.
  const std::deque<Entry>& aggregationDictionary() const { return entries_; }

 private:
  // Says of the number of an entry whether the entry is that of the pair.
  auto isPair(StringRef subsystem, StringRef category) const {
    return [=, this](uint32_t number) {
      const Key& key = entries_[number].key;
      return sameString(key.subsystem(), subsystem) && sameString(key.category(), category);
    };
  }
  const Entry* find(StringRef subsystem, StringRef category) const;

  // A deque, so that keys stay where they are and no capacity for twice the pairs lies idle.
  std::deque<Entry> entries_;
  FlatIndex index_;  // of the entries whose strings are present
  uint64_t totalCount_ = 0;
};

}  // namespace tessel
