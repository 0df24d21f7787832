// The slab of begins, their lists by age, and who loses his begins when room gets scarce.

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

// Whose turn it is when room is shared out: the user who took least so far, and among his programs
// the one that took least.
class Turns {
 public:
  explicit Turns(const Writers& writers) : writers_(writers), programs_(writers.users()) {}

  void join(uint32_t writer) {
    users_.set(writers_.userOf(writer), kNothingTaken);
    programs_[writers_.userOf(writer)].set(writers_.placeOf(writer), kNothingTaken);
  }
  // FlatIndex::kNone if nobody is left.
  uint32_t next() {
    while (!users_.empty() && users_.amountOf(users_.first()) != kLeft) {
      const uint32_t user = users_.first();
      const uint32_t place = programs_[user].first();
      if (programs_[user].amountOf(place) != kLeft) return writers_.at(user, place);
      users_.set(user, kLeft);
    }
    return FlatIndex::kNone;
  }
  void took(uint32_t writer, size_t room, bool wantsMore) {
    const uint32_t user = writers_.userOf(writer);
    const uint32_t place = writers_.placeOf(writer);
    users_.set(user, users_.amountOf(user) - room);
    programs_[user].set(place, wantsMore ? programs_[user].amountOf(place) - room : kLeft);
  }

 private:
  // A ranking puts the greatest amount first, so we count down from here.
  static constexpr uint64_t kNothingTaken = UINT64_MAX;
  static constexpr uint64_t kLeft = 0;

  const Writers& writers_;
  Ranking users_;
  std::vector<Ranking> programs_;  // by user
};

}  // namespace

// All memory is reserved at once, so the begins need not move. Pages that nobody touches cost
// nothing.
OpenIntervals::OpenIntervals(Writers& writers, OpenIntervalLimits limits)
    : writers_(writers), limits_(limits), intervals_(writers), attributes_(writers) {
  nodes_.reserve(limits.intervals + 1);
}

uint32_t OpenIntervals::numberOf(const IntervalKey& key, uint32_t hash) const {
  return index_.find(hash, [&](uint32_t number) { return nodes_[number].key == key; });
}

const OpenInterval* OpenIntervals::search(const IntervalKey& key) const {
  const uint32_t number = numberOf(key, hashOf(key));
  return number == kNone ? nullptr : &nodes_[number];
}

// The replaced interval leaves before the new one enters. So the new one becomes the youngest, and
// the attributes of the old one use up none of the limit. If everyone else holds less, even the new
// interval goes; one entry has at most 32 attributes, so only a limit below 32, as a test may set,
// can be exceeded by a single interval, which then stays.
OpenIntervals::Opened OpenIntervals::open(const IntervalKey& key, uint32_t writer,
                                          uint64_t monotonic, const PointTokens& tokens,
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
  node.isOpen = true;
  node.hash = hash;
  node.writer = writer;
  link(number);
  index_.add(hash, number);
  while (size() > limits_.intervals) drop(ends_[intervals_.greatest()].oldest);
  while (attributes_.total() > limits_.attributes && size() > 1)
    drop(ends_[attributes_.greatest()].oldest);
  return {number, replaced != kNone};
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
  Node& node = nodes_[number];
  if (ends_.size() <= node.writer) ends_.resize(node.writer + 1);
  Ends& ends = ends_[node.writer];
  node.older = ends.youngest;
  node.younger = kNone;
  (ends.youngest == kNone ? ends.oldest : nodes_[ends.youngest].younger) = number;
  ends.youngest = number;
  intervals_.change(node.writer, 1);
  if (!node.attributes.empty())
    attributes_.change(node.writer, static_cast<int64_t>(node.attributes.size()));
}

void OpenIntervals::remove(uint32_t number) {
  index_.erase(nodes_[number].hash, number);
  release(number);
  // Every open interval is both in the list of its writer and in the index. An interval that is
  // missing in the index would never meet its end. One that is missing in the list would never be
  // dropped.
  TESSEL_INVARIANT(index_.size() == size());
}

void OpenIntervals::drop(uint32_t number) {
  writers_.lost(nodes_[number].writer, LossCode::openIntervalDropped);
  remove(number);
}

void OpenIntervals::release(uint32_t number) {
  Node& node = nodes_[number];
  Ends& ends = ends_[node.writer];
  (node.older == kNone ? ends.oldest : nodes_[node.older].younger) = node.younger;
  (node.younger == kNone ? ends.youngest : nodes_[node.younger].older) = node.older;
  intervals_.change(node.writer, -1);
  if (!node.attributes.empty())
    attributes_.change(node.writer, -static_cast<int64_t>(node.attributes.size()));
  node.isOpen = false;
  node.attributes = std::vector<FieldToken>();  // clear() would keep the memory of each free node
  node.older = std::exchange(free_, number);
}

// New tokens give each key a new hash, so we build the index anew. The writer who took least so far
// is served next. So whoever needs little gets all of it, and the others get equal parts of the
// rest. A text that two writers share counts only for the one who is served first.
void OpenIntervals::renewAll(const std::function<std::optional<size_t>(OpenInterval&)>& renew) {
  index_.clear();
  Turns turns(writers_);
  std::vector<uint32_t> left(ends_.size());  // by writer: the youngest one that is left
  for (uint32_t writer = 0; writer < ends_.size(); ++writer) {
    left[writer] = ends_[writer].youngest;
    if (left[writer] != kNone) turns.join(writer);
  }
  for (uint32_t writer = turns.next(); writer != kNone; writer = turns.next()) {
    Node& node = nodes_[left[writer]];
    const std::optional<size_t> room = renew(node);
    if (!room) break;
    node.hash = hashOf(node.key);
    index_.add(node.hash, left[writer]);
    left[writer] = node.older;
    turns.took(writer, *room, node.older != kNone);
  }
  for (uint32_t at : left) {
    while (at != kNone) {
      const uint32_t older = nodes_[at].older;
      writers_.lost(nodes_[at].writer, LossCode::openIntervalDropped);
      release(at);
      at = older;
    }
  }
  TESSEL_INVARIANT(index_.size() == size());
}

}  // namespace tessel
