// Counting by (subsystem, category).

#include "filter/TesselReporterAggregation.h"

#include <algorithm>

namespace tessel {

namespace {

// Where a pair starts probing. Not the key's hash: exclusive or puts every pair of two equal
// strings on 0, and a writer is free to record nothing else.
size_t firstSlot(StringRef subsystem, StringRef category) {
  constexpr uint64_t kOdd = 0x9e3779b97f4a7c15u;
  const uint64_t mixed = subsystem.hash() * kOdd + category.hash();
  return mixed ^ (mixed >> 32);
}

bool bothPresent(StringRef subsystem, StringRef category) {
  return subsystem.present() && category.present();
}

}  // namespace

bool TesselReporterAggregationKey::isEqual(const TesselReporterAggregationKey& other) const {
  if (this == &other) return true;
  return sameString(subsystem_, other.subsystem_) && sameString(category_, other.category_);
}

std::string TesselReporterAggregationKey::description() const {
  std::string text(subsystem_.textOr("(null)"));
  text += '/';
  text += category_.textOr("(null)");
  return text;
}

void TesselReporterAggregation::incrementSubsystem(StringRef subsystem, StringRef category) {
  ++totalCount_;
  if (!bothPresent(subsystem, category)) {
    entries_.push_back({Key(subsystem, category), 1});
    return;
  }
  if (slots_.empty()) makeRoom();
  size_t slot = slotFor(subsystem, category);
  if (slots_[slot] != 0) {
    ++entries_[slots_[slot] - 1].count;
    return;
  }
  if ((slotsTaken_ + 1) * 2 > slots_.size()) {
    makeRoom();
    slot = slotFor(subsystem, category);
  }
  entries_.push_back({Key(subsystem, category), 1});
  slots_[slot] = static_cast<Index>(entries_.size());
  ++slotsTaken_;
}

uint64_t TesselReporterAggregation::countForSubsystem(StringRef subsystem,
                                                      StringRef category) const {
  const Entry* entry = find(subsystem, category);
  return entry ? entry->count : 0;
}

uint64_t TesselReporterAggregation::countForKey(const Key& key) const {
  if (bothPresent(key.subsystem(), key.category()))
    return countForSubsystem(key.subsystem(), key.category());
  const auto own = std::ranges::find(entries_, &key, [](const Entry& entry) { return &entry.key; });
  return own == entries_.end() ? 0 : own->count;
}

std::vector<const TesselReporterAggregationKey*>
TesselReporterAggregation::keysInDescendingCountOrder() const {
  std::vector<const Entry*> order;
  order.reserve(entries_.size());
  for (const Entry& entry : entries_) order.push_back(&entry);
  std::ranges::stable_sort(order, std::ranges::greater(), &Entry::count);

  std::vector<const Key*> keys;
  keys.reserve(order.size());
  for (const Entry* entry : order) keys.push_back(&entry->key);
  return keys;
}

size_t TesselReporterAggregation::slotFor(StringRef subsystem, StringRef category) const {
  const size_t mask = slots_.size() - 1;
  size_t slot = firstSlot(subsystem, category) & mask;
  for (; slots_[slot] != 0; slot = (slot + 1) & mask) {
    const Key& key = entries_[slots_[slot] - 1].key;
    if (sameString(key.subsystem(), subsystem) && sameString(key.category(), category)) break;
  }
  return slot;
}

const TesselReporterAggregation::Entry* TesselReporterAggregation::find(StringRef subsystem,
                                                                        StringRef category) const {
  if (slots_.empty() || !bothPresent(subsystem, category)) return nullptr;
  const Index index = slots_[slotFor(subsystem, category)];
  return index == 0 ? nullptr : &entries_[index - 1];
}

void TesselReporterAggregation::makeRoom() {
  slots_.assign(slots_.empty() ? 16 : slots_.size() * 2, 0);
  for (size_t index = 0; index < entries_.size(); ++index) {
    const Key& key = entries_[index].key;
    if (!bothPresent(key.subsystem(), key.category())) continue;
    slots_[slotFor(key.subsystem(), key.category())] = static_cast<Index>(index + 1);
  }
}

}  // namespace tessel
