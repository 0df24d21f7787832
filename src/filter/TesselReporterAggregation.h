// TesselReporterAggregation: how many trace objects each (subsystem, category) pair contributed.
//
// Counting copies and hashes no text: a new pair takes a share of the strings that it is given, and
// a known one takes nothing. An entry has 24 bytes, its place in the index 16 to 32.
//
// Threads: one at a time. Keys handed out are valid while the aggregation lives.

#pragma once

#include <cstdint>
#include <deque>
#include <string>
#include <utility>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/Values.h"

namespace tessel {

class TesselReporterAggregationKey {
 public:
  TesselReporterAggregationKey(SharedString subsystem, SharedString category)
      : subsystem_(std::move(subsystem)), category_(std::move(category)) {}

  const SharedString& subsystem() const { return subsystem_; }
  const SharedString& category() const { return category_; }

  // Equal keys have equal hashes; an absent string contributes 0.
  uint64_t hash() const { return subsystem_.hash() ^ category_.hash(); }
  // True if both are the same object, or if all four strings are present and pairwise equal. So a
  // key with an absent string does not even equal its copies.
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

  // The pair's count; 0 for a pair that was not counted or has an absent string.
  uint64_t countForSubsystem(StringRef subsystem, StringRef category) const;
  // The count of the key that equals `key`; 0 if there is none. A key with an absent string only
  // finds its count if this aggregation handed it out.
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

  // A deque, because keys that were handed out must stay where they are, and a vector would hold
  // memory for up to twice the pairs.
  std::deque<Entry> entries_;
  FlatIndex index_;  // of the entries whose strings are present
  uint64_t totalCount_ = 0;
};

}  // namespace tessel
