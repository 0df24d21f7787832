// KeyedCounts: counts by a few strings that are taken together.
//
// A search borrows the strings of its key and copies nothing. Only a key that is new takes a share
// of its strings, so that they outlive the object they came with. An absent string is another key
// than an empty one.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <utility>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/Values.h"

namespace tessel::ctl {

template <size_t N, typename Count>
class KeyedCounts {
 public:
  struct Key {
    std::array<StringRef, N> texts;
    uint8_t slot = 0;
  };
  struct Entry {
    std::array<SharedString, N> texts;
    uint8_t slot = 0;
    Count count{};
  };

  // The count of the key; null where it has none. Valid until the next add().
  const Count* find(const Key& key) const {
    const uint32_t number =
        index_.find(hashOf(key), [&](uint32_t other) { return matches(entries_[other], key); });
    return number == FlatIndex::kNone ? nullptr : &entries_[number].count;
  }
  Count* find(const Key& key) { return const_cast<Count*>(std::as_const(*this).find(key)); }
  // The new count of a key. REQUIRES: it has none.
  Count& add(const Key& key) {
    index_.add(hashOf(key), static_cast<uint32_t>(entries_.size()));
    Entry entry{{}, key.slot, {}};
    std::copy(key.texts.begin(), key.texts.end(), entry.texts.begin());
    entries_.push_back(std::move(entry));
    return entries_.back().count;
  }
  // In the order in which they were added.
  const std::vector<Entry>& entries() const { return entries_; }

 private:
  // The hashes of the texts are seeded, so a sum of them needs no seed of its own.
  static uint32_t hashOf(const Key& key) {
    uint64_t hash = key.slot;
    for (const StringRef text : key.texts) hash = hash * 0x9e3779b97f4a7c15u + text.hash();
    return static_cast<uint32_t>(hash ^ hash >> 32);
  }
  static bool matches(const Entry& entry, const Key& key) {
    for (size_t at = 0; at < N; ++at) {
      const StringRef own = entry.texts[at];
      const bool same = own.present() ? sameString(own, key.texts[at]) : !key.texts[at].present();
      if (!same) return false;
    }
    return entry.slot == key.slot;
  }
  std::vector<Entry> entries_;
  FlatIndex index_;  // of entries_
};

}  // namespace tessel::ctl
