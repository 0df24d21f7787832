// Counting by (subsystem, category).
//
// Pairs with an absent string stay out of the index, since they equal nothing and would only fill
// it. They are rare: the extraction delivers no object without subsystem and category.

#include "filter/TesselReporterAggregation.h"

#include <algorithm>

namespace tessel {

namespace {

// The hash under which a pair is found. The key's own hash() will not do: exclusive or makes it 0
// for every pair of two equal strings, and a writer is free to record nothing else.
uint32_t hashOf(StringRef subsystem, StringRef category) {
  constexpr uint64_t kOdd = 0x9e3779b97f4a7c15u;
  const uint64_t mixed = subsystem.hash() * kOdd + category.hash();
  return static_cast<uint32_t>(mixed ^ (mixed >> 32));
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
  // First, so that the total holds whichever way the pair is counted.
  ++totalCount_;
  if (!bothPresent(subsystem, category)) {
    entries_.push_back({Key(subsystem, category), 1});
    return;
  }
  // A new pair begins at 0, because the increment below is for new and known pairs alike.
  const auto add = [&] {
    entries_.push_back({Key(subsystem, category), 0});
    return static_cast<uint32_t>(entries_.size() - 1);
  };
  const uint32_t number =
      index_.findOrAdd(hashOf(subsystem, category), isPair(subsystem, category), add);
  ++entries_[number].count;
}

uint64_t TesselReporterAggregation::countForSubsystem(StringRef subsystem,
                                                      StringRef category) const {
  const Entry* entry = find(subsystem, category);
  return entry ? entry->count : 0;
}

uint64_t TesselReporterAggregation::countForKey(const Key& key) const {
  if (bothPresent(key.subsystem(), key.category()))
    return countForSubsystem(key.subsystem(), key.category());
  // Such a key equals nothing but itself, so it is known by its place in memory.
  const auto own = std::ranges::find(entries_, &key, [](const Entry& entry) { return &entry.key; });
  return own == entries_.end() ? 0 : own->count;
}

std::vector<const TesselReporterAggregationKey*>
TesselReporterAggregation::keysInDescendingCountOrder() const {
  std::vector<const Entry*> order;
  order.reserve(entries_.size());
  for (const Entry& entry : entries_) order.push_back(&entry);
  // Stable: of equal counts the pair that appeared first comes first, and is the one that is sent.
  std::ranges::stable_sort(order, std::ranges::greater(), &Entry::count);

  std::vector<const Key*> keys;
  keys.reserve(order.size());
  for (const Entry* entry : order) keys.push_back(&entry->key);
  return keys;
}

const TesselReporterAggregation::Entry* TesselReporterAggregation::find(StringRef subsystem,
                                                                        StringRef category) const {
  if (!bothPresent(subsystem, category)) return nullptr;
  const uint32_t number = index_.find(hashOf(subsystem, category), isPair(subsystem, category));
  return number == FlatIndex::kNone ? nullptr : &entries_[number];
}

}  // namespace tessel
