// Linear probing with backward shift, a slab with a free list, and the list by age.

#include "trace/OpenIntervals.h"

#include <random>
#include <utility>

namespace tessel {

namespace {

constexpr size_t kFirstSlots = 64;

// A writer chooses the order in which tokens are given out; without a secret it could choose keys
// that all land in one place.
uint64_t randomSeed() {
  std::random_device device;
  return (uint64_t{device()} << 32) | device();
}

__extension__ using Wide = unsigned __int128;

uint64_t mix(uint64_t a, uint64_t b) {
  const Wide product = Wide{a} * b;
  return static_cast<uint64_t>(product) ^ static_cast<uint64_t>(product >> 64);
}

constexpr uint64_t pairOf(uint32_t high, uint32_t low) { return (uint64_t{high} << 32) | low; }

}  // namespace

OpenIntervals::OpenIntervals(OpenIntervalLimits limits)
    : limits_(limits), seed_(randomSeed()), slots_(kFirstSlots) {}

uint32_t OpenIntervals::hashOf(const IntervalKey& key) const {
  uint64_t hash = mix(pairOf(key.boot, key.subsystem) ^ seed_, 0x9e3779b97f4a7c15u);
  hash = mix(pairOf(key.category, key.name) ^ hash, 0xd1b54a32d192ed03u ^ seed_);
  hash = mix(key.id ^ hash, 0x8cb92ba72f3d8dd7u);
  hash = mix(key.process ^ hash, 0x9e3779b97f4a7c15u);
  return static_cast<uint32_t>(hash ^ (hash >> 32));
}

// The slot of the key, or the empty slot where it would stand.
size_t OpenIntervals::slotOf(const IntervalKey& key, uint32_t hash) const {
  const size_t mask = slots_.size() - 1;
  size_t at = hash & mask;
  while (slots_[at].node != kNone &&
         (slots_[at].hash != hash || nodes_[slots_[at].node].interval.key != key)) {
    at = (at + 1) & mask;
  }
  return at;
}

const OpenInterval* OpenIntervals::find(const IntervalKey& key) const {
  const uint32_t node = slots_[slotOf(key, hashOf(key))].node;
  return node == kNone ? nullptr : &nodes_[node].interval;
}

void OpenIntervals::open(const IntervalKey& key, uint64_t monotonic, const PointTokens& tokens,
                         const std::vector<FieldToken>& attributes) {
  const uint32_t hash = hashOf(key);
  const size_t slot = slotOf(key, hash);
  if (slots_[slot].node != kNone) removeAt(slot);
  attributes_ += attributes.size();
  const uint32_t node = newNode();
  OpenInterval& interval = nodes_[node].interval;
  interval.key = key;
  interval.monotonic = monotonic;
  interval.tokens = tokens;
  interval.attributes = attributes;
  nodes_[node].hash = hash;
  link(node);
  if (++size_ * 2 > slots_.size()) grow();
  insertSlot(node);
  while (size_ > limits_.intervals || (attributes_ > limits_.attributes && size_ > 1)) {
    remove(oldest_);
    ++dropped_;
  }
}

void OpenIntervals::close(const OpenInterval* interval) {
  removeAt(slotOf(interval->key, hashOf(interval->key)));
}

uint32_t OpenIntervals::newNode() {
  if (free_.empty()) {
    nodes_.emplace_back();
    return static_cast<uint32_t>(nodes_.size() - 1);
  }
  const uint32_t node = free_.back();
  free_.pop_back();
  return node;
}

void OpenIntervals::link(uint32_t node) {
  nodes_[node].older = youngest_;
  nodes_[node].younger = kNone;
  (youngest_ == kNone ? oldest_ : nodes_[youngest_].younger) = node;
  youngest_ = node;
}

void OpenIntervals::remove(uint32_t node) {
  removeAt(slotOf(nodes_[node].interval.key, nodes_[node].hash));
}

void OpenIntervals::removeAt(size_t slot) {
  const uint32_t at = slots_[slot].node;
  Node& node = nodes_[at];
  (node.older == kNone ? oldest_ : nodes_[node.older].younger) = node.younger;
  (node.younger == kNone ? youngest_ : nodes_[node.younger].older) = node.older;
  attributes_ -= node.interval.attributes.size();
  node.interval.attributes = std::vector<FieldToken>();  // gives its memory back
  free_.push_back(at);
  --size_;
  eraseSlot(slot);
}

void OpenIntervals::insertSlot(uint32_t node) {
  const size_t mask = slots_.size() - 1;
  size_t at = nodes_[node].hash & mask;
  while (slots_[at].node != kNone) at = (at + 1) & mask;
  slots_[at] = {nodes_[node].hash, node};
}

// Moves back what would no longer be found past the hole.
void OpenIntervals::eraseSlot(size_t hole) {
  const size_t mask = slots_.size() - 1;
  for (size_t at = (hole + 1) & mask; slots_[at].node != kNone; at = (at + 1) & mask) {
    const size_t home = slots_[at].hash & mask;
    if (((at - home) & mask) < ((at - hole) & mask)) continue;
    slots_[hole] = slots_[at];
    hole = at;
  }
  slots_[hole] = {};
}

void OpenIntervals::grow() {
  std::vector<Slot> old(slots_.size() * 2);
  old.swap(slots_);
  for (const Slot& slot : old) {
    if (slot.node != kNone) insertSlot(slot.node);
  }
}

// Drops `node` and all that are older. The slots are put right by rehash().
void OpenIntervals::dropFrom(uint32_t node) {
  oldest_ = nodes_[node].younger;
  (oldest_ == kNone ? youngest_ : nodes_[oldest_].older) = kNone;
  for (uint32_t at = node; at != kNone; at = nodes_[at].older) {
    attributes_ -= nodes_[at].interval.attributes.size();
    nodes_[at].interval.attributes = std::vector<FieldToken>();
    free_.push_back(at);
    --size_;
    ++dropped_;
  }
}

void OpenIntervals::rehash() {
  slots_.assign(slots_.size(), Slot{});
  for (uint32_t at = youngest_; at != kNone; at = nodes_[at].older) {
    nodes_[at].hash = hashOf(nodes_[at].interval.key);
    insertSlot(at);
  }
}

}  // namespace tessel
