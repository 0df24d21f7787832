// Numbering writers, counting their losses, and ranking them.

#include "trace/Writers.h"

#include <algorithm>
#include <functional>

#include "platform/Invariant.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// The record of a run shortens a place to this length.
constexpr size_t kMaxNameBytes = 256;

// In the order of the codes, from lostAtSource on.
constexpr std::string_view kWords[] = {"the journal had no room for them",
                                       "told by programs that began to lose before the period",
                                       "begins that were too many to wait",
                                       "too many pairs of subsystem and category",
                                       "too many executables",
                                       "too much text for one run",
                                       "too much of the time of a run"};

}  // namespace

// Nearly every writer was met before, so we look for the writer first and for the user only if that
// fails. Keys are seeded hashes, so nobody can make two programs that share one.
uint32_t Writers::numberOf(const Origin& origin) {
  const uint64_t key = keyOf(origin.user);
  const uint64_t image = origin.image.hash();
  const uint32_t hash = hashWords(key, image);
  const uint32_t known = writerIndex_.find(hash, [&](uint32_t number) {
    return writers_[number].image == image && users_[writers_[number].user].key == key;
  });
  if (known != kNone) return known;
  const uint32_t user = userNumber(key);
  const bool room = users_[user].key == key && writers_.size() < limits_.programs &&
                    users_[user].writers.size() < limits_.programsOfAUser;
  if (!room) {
    if (users_[user].other == kNone) users_[user].other = add(user, 0, "other");
    return users_[user].other;
  }
  const std::string_view path = origin.image.textOr("unknown");
  const uint32_t number = add(user, image, shortPlainText(path, kMaxNameBytes));
  writerIndex_.add(hash, number);
  return number;
}

uint32_t Writers::userNumber(uint64_t key) {
  const auto isUser = [&](uint32_t number) { return users_[number].key == key; };
  const uint32_t known = userIndex_.find(hashWords(key), isUser);
  if (known != kNone) return known;
  if (key != kOtherUsers && users_.size() >= limits_.users) return userNumber(kOtherUsers);
  users_.push_back({key, {}});
  userIndex_.add(hashWords(key), static_cast<uint32_t>(users_.size() - 1));
  return static_cast<uint32_t>(users_.size() - 1);
}

uint32_t Writers::add(uint32_t user, uint64_t image, std::string name) {
  const auto number = static_cast<uint32_t>(writers_.size());
  std::vector<uint32_t>& ofUser = users_[user].writers;
  writers_.push_back({user, static_cast<uint32_t>(ofUser.size()), image, std::move(name)});
  ofUser.push_back(number);
  return number;
}

void Writers::lost(uint32_t writer, LossCode code, uint64_t count) {
  TESSEL_INVARIANT(isOfWriter(code));
  writers_[writer].lost[indexOf(code)] += count;
  sums_[indexOf(code)] += count;
}

void Writers::addLosses(Losses& losses) const {
  for (size_t code = 0; code < kCodes; ++code)
    addLosses(static_cast<LossCode>(code + kFirstCode), losses);
}

LossPlace Writers::placeFor(const Writer& writer) const {
  const uint64_t key = users_[writer.user].key;
  LossPlace place{writer.name, {}, {}};
  if (key < kUnknownUser) place.user = static_cast<uint32_t>(key);
  return place;
}

// The list keeps the first losses of a code apart and sums up the others. So the writers who lost
// most come first. But what a program tells of itself may be a lie, and one user can run many
// programs that lie. So for these codes each user comes once before any comes twice.
void Writers::addLosses(LossCode code, Losses& losses) const {
  const size_t index = indexOf(code);
  if (sums_[index] == 0) return;
  struct Loser {
    const Writer* writer;
    size_t round = 0;
  };
  std::vector<Loser> losers;
  for (const Writer& writer : writers_) {
    if (writer.lost[index] != 0) losers.push_back({&writer});
  }
  std::ranges::stable_sort(losers, std::greater{},
                           [index](const Loser& loser) { return loser.writer->lost[index]; });
  if (!isOverShare(code)) {
    std::vector<size_t> ofUser(users_.size());
    for (Loser& loser : losers) loser.round = ofUser[loser.writer->user]++;
    std::ranges::stable_sort(losers, {}, &Loser::round);
  }
  for (const Loser& loser : losers)
    losses.add(code, kWords[index], placeFor(*loser.writer), loser.writer->lost[index]);
}

void Ranking::put(size_t place, uint32_t holder) {
  heap_[place] = holder;
  places_[holder] = static_cast<uint32_t>(place);
}

// A holder moves up while it has more than the one above, and then down while one below has more.
// Only one of the two moves can happen.
void Ranking::set(uint32_t holder, uint64_t amount) {
  while (amounts_.size() <= holder) {
    amounts_.push_back(0);
    places_.push_back(static_cast<uint32_t>(heap_.size()));
    heap_.push_back(static_cast<uint32_t>(amounts_.size() - 1));
  }
  amounts_[holder] = amount;
  size_t place = places_[holder];
  for (; place != 0 && above(holder, heap_[(place - 1) / 2]); place = (place - 1) / 2)
    put(place, heap_[(place - 1) / 2]);
  for (size_t below = 2 * place + 1; below < heap_.size(); below = 2 * place + 1) {
    if (below + 1 < heap_.size() && above(heap_[below + 1], heap_[below])) ++below;
    if (!above(heap_[below], holder)) break;
    put(place, heap_[below]);
    place = below;
  }
  put(place, holder);
}

void Holdings::rank(uint32_t writer, int64_t by) {
  const uint32_t user = writers_.userOf(writer);
  if (programs_.size() <= user) programs_.resize(user + 1);
  programs_[user].set(writers_.placeOf(writer), held_[writer]);
  users_.set(user, users_.amountOf(user) + static_cast<uint64_t>(by));
}

uint32_t Holdings::greatest() {
  TESSEL_INVARIANT(total_ != 0);  // otherwise nobody holds what is to be taken back
  if (!ranked_) {
    for (uint32_t writer = 0; writer < held_.size(); ++writer)
      rank(writer, static_cast<int64_t>(held_[writer]));
    ranked_ = true;
  }
  const uint32_t user = users_.first();
  return writers_.at(user, programs_[user].first());
}

}  // namespace tessel
