// Counting by (subsystem, category).
//
// A pair with an absent string is not put into the index: it equals no other pair, so no search
// could find it. A run meets no such pair, because the extraction delivers no object without a
// subsystem and a category.

#include "filter/TesselReporterAggregation.h"

#include <algorithm>

namespace tessel {

namespace {

// The hash of a pair in the index. We cannot use the key's own hash(): it is an exclusive or, and
// that is 0 for every pair of two equal strings. A writer who records only such pairs would put all
// of them on one hash, and each search would compare them all. The multiplication by an odd number
// makes the two strings count differently.
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
  // Both branches below add 1 to one entry, so the total stays the sum of all counts.
  ++totalCount_;
  if (!bothPresent(subsystem, category)) {
    entries_.push_back({Key(subsystem, category), 1});
    return;
  }
  // A new entry begins at 0, because the last line of this function raises new and known entries
  // alike.
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
  // A key with an absent string equals only itself, so we look for its address.
  const auto own = std::ranges::find(entries_, &key, [](const Entry& entry) { return &entry.key; });
  return own == entries_.end() ? 0 : own->count;
}

std::vector<const TesselReporterAggregationKey*>
TesselReporterAggregation::keysInDescendingCountOrder() const {
  std::vector<const Entry*> order;
  order.reserve(entries_.size());
  for (const Entry& entry : entries_) order.push_back(&entry);
  // The summary sends only the first few keys. A stable sort makes that choice depend on nothing
  // but the order of the objects, so the same store gives the same events.
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
