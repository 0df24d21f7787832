// TesselReporterAggregation: how many trace objects each (subsystem, category) pair contributed.
//
// Counting copies and hashes no text. A new pair takes a reference to each of its strings; a known
// pair only raises its count. A pair costs 24 bytes for its entry and 16 to 32 in the index.
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
  // True if both are the same object, or if all four strings are present and pairwise equal. A key
  // with an absent string therefore differs even from its own copy.
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

  // Counts one object. A pair with an absent string equals no other pair, so each such object makes
  // an entry of its own.
  void incrementSubsystem(StringRef subsystem, StringRef category);

  // The count of the pair. 0 if the pair was never counted, or if one of its strings is absent.
  uint64_t countForSubsystem(StringRef subsystem, StringRef category) const;
  // The count of the entry whose key equals `key`; 0 if there is none. A key with an absent string
  // finds its count only if it is a key of this aggregation itself, not a copy.
  uint64_t countForKey(const Key& key) const;
  // Every key once, larger counts first. Among equal counts, the pair that appeared first is first.
  std::vector<const Key*> keysInDescendingCountOrder() const;

  // The sum of all counts.
  uint64_t totalCount() const { return totalCount_; }
  // One entry per distinct key, in the order in which they first appeared. Counts are at least 1.
  const std::deque<Entry>& aggregationDictionary() const { return entries_; }

 private:
  // Makes a predicate for the index: does the entry with this number belong to the pair?
  auto isPair(StringRef subsystem, StringRef category) const {
    return [=, this](uint32_t number) {
      const Key& key = entries_[number].key;
      return sameString(key.subsystem(), subsystem) && sameString(key.category(), category);
    };
  }
  const Entry* find(StringRef subsystem, StringRef category) const;

  // A deque, because a pointer to a key must stay valid when the next pair is added. A vector moves
  // its elements when it grows.
  std::deque<Entry> entries_;
  FlatIndex index_;  // finds the entries that have both strings
  uint64_t totalCount_ = 0;
};

}  // namespace tessel
