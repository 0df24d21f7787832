// The slab of begins, their list by age, and the limits.

#include "trace/OpenIntervals.h"

#include <utility>

#include "platform/Invariant.h"

namespace tessel {

namespace {

constexpr uint64_t pairOf(uint32_t high, uint32_t low) { return (uint64_t{high} << 32) | low; }

// A writer chooses the order of the tokens, so it could choose keys that all fall into one place of
// the index and make each search slow. A seeded hash prevents that.
uint32_t hashOf(const IntervalKey& key) {
  return hashWords(pairOf(key.boot, key.subsystem), pairOf(key.category, key.name), key.id,
                   uint64_t{key.process});
}

}  // namespace

OpenIntervals::OpenIntervals(OpenIntervalLimits limits) : limits_(limits) {}

uint32_t OpenIntervals::numberOf(const IntervalKey& key, uint32_t hash) const {
  return index_.find(hash, [&](uint32_t number) { return nodes_[number].key == key; });
}

const OpenInterval* OpenIntervals::find(const IntervalKey& key) const {
  const uint32_t number = numberOf(key, hashOf(key));
  return number == kNone ? nullptr : &nodes_[number];
}

// The replaced interval leaves before the new one enters. So the new one becomes the youngest, and
// the attributes of the old one use up none of the limit.
bool OpenIntervals::open(const IntervalKey& key, uint64_t monotonic, const PointTokens& tokens,
                         const std::vector<FieldToken>& attributes) {
  const uint32_t hash = hashOf(key);
  const uint32_t replaced = numberOf(key, hash);
  if (replaced != kNone) remove(replaced);
  const uint32_t number = newNode();
  Node& node = nodes_[number];
  node.key = key;
  node.monotonic = monotonic;
  node.tokens = tokens;
  node.attributes = attributes;
  attributes_ += attributes.size();
  node.hash = hash;
  link(number);
  index_.add(hash, number);
  // We never drop the interval that was just opened. One entry has at most 32 attributes, so only a
  // limit below 32, as a test may set, can be exceeded by a single interval.
  while (size_ > limits_.intervals || (attributes_ > limits_.attributes && size_ > 1)) {
    remove(oldest_);
    ++dropped_;
  }
  return replaced != kNone;
}

// The place of a node in the slab is its number, so close() needs no second search by key.
void OpenIntervals::close(const OpenInterval* interval) {
  remove(static_cast<uint32_t>(static_cast<const Node*>(interval) - nodes_.data()));
}

// We use free nodes first, so the slab has no more nodes than were ever needed at once. The free
// nodes are linked through `older`, so their list takes no memory of its own.
uint32_t OpenIntervals::newNode() {
  if (free_ == kNone) {
    nodes_.emplace_back();
    return static_cast<uint32_t>(nodes_.size() - 1);
  }
  return std::exchange(free_, nodes_[free_].older);
}

void OpenIntervals::link(uint32_t number) {
  nodes_[number].older = youngest_;
  nodes_[number].younger = kNone;
  (youngest_ == kNone ? oldest_ : nodes_[youngest_].younger) = number;
  youngest_ = number;
  ++size_;
}

void OpenIntervals::remove(uint32_t number) {
  index_.erase(nodes_[number].hash, number);
  release(number);
  // Every open interval is both in the list by age and in the index. An interval that is missing in
  // the index would never meet its end. One that is missing in the list would never be dropped.
  TESSEL_INVARIANT(index_.size() == size_);
}

void OpenIntervals::release(uint32_t number) {
  Node& node = nodes_[number];
  (node.older == kNone ? oldest_ : nodes_[node.older].younger) = node.younger;
  (node.younger == kNone ? youngest_ : nodes_[node.younger].older) = node.older;
  attributes_ -= node.attributes.size();
  node.attributes = std::vector<FieldToken>();  // clear() would keep the memory of each free node
  node.older = std::exchange(free_, number);
  --size_;
}

// New tokens give each key a new hash, so we build the index anew. We start with the youngest
// interval: if there is no room for all, the oldest must go, as with the limits.
void OpenIntervals::renewAll(const std::function<bool(OpenInterval&)>& renew) {
  index_.clear();
  uint32_t at = youngest_;
  for (; at != kNone && renew(nodes_[at]); at = nodes_[at].older) {
    nodes_[at].hash = hashOf(nodes_[at].key);
    index_.add(nodes_[at].hash, at);
  }
  while (at != kNone) {
    const uint32_t older = nodes_[at].older;
    release(at);
    ++dropped_;
    at = older;
  }
  TESSEL_INVARIANT(index_.size() == size_);
}

}  // namespace tessel
