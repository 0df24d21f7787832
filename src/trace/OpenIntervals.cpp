// The slab of begins, their list by age, and the bounds.

#include "trace/OpenIntervals.h"

#include <utility>

#include "platform/Invariant.h"

namespace tessel {

namespace {

constexpr uint64_t pairOf(uint32_t high, uint32_t low) { return (uint64_t{high} << 32) | low; }

// Seeded, because a writer chooses the order in which tokens are given out and so could choose keys
// that all land in one place.
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

// The interval that is replaced goes before the new one comes: the new one then stands at the young
// end of the list, and the attributes of the old one do not count against it.
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
  // The last interval stays whatever it carries. An entry has at most 32 attributes, so only a
  // limit below that, as tests set it, could ask for more.
  while (size_ > limits_.intervals || (attributes_ > limits_.attributes && size_ > 1)) {
    remove(oldest_);
    ++dropped_;
  }
  return replaced != kNone;
}

// The place in the slab is the number, so closing needs no second search by key.
void OpenIntervals::close(const OpenInterval* interval) {
  remove(static_cast<uint32_t>(static_cast<const Node*>(interval) - nodes_.data()));
}

// Free nodes are used first, so the slab never has more nodes than intervals were open at once. The
// free ones are a list through `older`, which takes no memory of its own.
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
  // Every open interval stands in the list by age and in the index. One that is only in the list
  // would never meet its end, and one that is only in the index would never be dropped.
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

// The hash of a key comes from its tokens, so the index is made anew. It goes from the youngest to
// the oldest, because those that find no room are to be the oldest, as with the other limits.
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
