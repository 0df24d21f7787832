// KeyedCounts: counts by a few strings that are taken together.
//
// A key is looked for as its strings are borrowed, by addresses and hashes, and takes a share of
// them once, when it is new. Absent strings are told apart from empty ones.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <vector>

#include "platform/SharedString.h"

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
  Count* find(const Key& key) {
    const size_t at = slotOf(key, hashOf(key));
    return slots_[at].number == 0 ? nullptr : &entries_[slots_[at].number - 1].count;
  }
  // The new count of a key. REQUIRES: it has none.
  Count& add(const Key& key) {
    if (entries_.size() * 2 >= slots_.size()) grow();
    Entry entry{{}, key.slot, {}};
    std::copy(key.texts.begin(), key.texts.end(), entry.texts.begin());
    entries_.push_back(std::move(entry));
    const uint32_t hash = hashOf(key);
    slots_[slotOf(key, hash)] = {hash, static_cast<uint32_t>(entries_.size())};
    return entries_.back().count;
  }
  // In the order in which they were added.
  const std::vector<Entry>& entries() const { return entries_; }

 private:
  // Open addressing. The hash stands beside the number, so that a search for a key that has no
  // count looks at nothing else.
  struct Slot {
    uint32_t hash = 0;
    uint32_t number = 0;  // of the entry, from 1 on; 0: the slot is free
  };

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
  // The slot of the key, or the free one where it would stand.
  size_t slotOf(const Key& key, uint32_t hash) const {
    const size_t mask = slots_.size() - 1;
    for (size_t at = hash & mask;; at = (at + 1) & mask) {
      const Slot& slot = slots_[at];
      if (slot.number == 0 || (slot.hash == hash && matches(entries_[slot.number - 1], key)))
        return at;
    }
  }
  void grow() {
    std::vector<Slot> old(slots_.size() * 2);
    old.swap(slots_);
    const size_t mask = slots_.size() - 1;
    for (const Slot& slot : old) {
      if (slot.number == 0) continue;
      size_t at = slot.hash & mask;
      while (slots_[at].number != 0) at = (at + 1) & mask;
      slots_[at] = slot;
    }
  }

  std::vector<Entry> entries_;
  std::vector<Slot> slots_ = std::vector<Slot>(64);
};

}  // namespace tessel::ctl
