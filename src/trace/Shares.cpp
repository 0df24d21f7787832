// The rule of the last quarter, and the books of what was given away.

#include "trace/Shares.h"

#include <algorithm>
#include <string>

#include "platform/Invariant.h"
#include "platform/Json.h"
#include "platform/Text.h"

namespace tessel {

namespace {

constexpr uint64_t threeQuarters(uint64_t whole) { return whole - whole / 4; }
constexpr uint64_t sixteenth(uint64_t whole) { return whole / 16; }

size_t sizeOf(StringRef text) { return text.textOr("").size(); }

// More than the two rows of an object can take: a payload has at most 11 texts, and JSON makes
// 24,000 bytes of the longest.
constexpr uint64_t kMostSpaceOfObject = uint64_t{1} << 20;
// Keys, numbers and constant texts of a payload.
constexpr size_t kBesideTexts = 512;

constexpr FieldKind kArguments[] = {FieldKind::string1Name, FieldKind::string1Value,
                                    FieldKind::string2Name, FieldKind::string2Value,
                                    FieldKind::number1Name, FieldKind::number2Name};

size_t jsonSize(const ObjectOffer& offer, FieldToken token) {
  std::string json;
  appendJsonString(json, offer.table.text(token).textOr(""));
  return json.size();
}

}  // namespace

Shares::Shares(Writers& writers, const ShareLimits& limits)
    : writers_(writers),
      limits_{limits.pairs,    limits.pairBytes,   limits.images,  limits.imageBytes,
              limits.rowBytes, limits.nanoseconds, limits.counters},
      spaceOfRow_(limits.spaceOfRow) {
  for (size_t kind = 0; kind < kKinds; ++kind)
    openToAll_[kind] = threeQuarters(threeQuarters(limits_[kind]));
  noteScarcity();
}

void Shares::noteScarcity() {
  scarce_ = given_[kTime] >= openToAll_[kTime] ||
            given_[kRowBytes] + kMostSpaceOfObject > openToAll_[kRowBytes];
}

bool Shares::weighs(const ObjectOffer& offer) {
  if (generation_ != offer.table.generation()) {
    std::ranges::fill(recentPairs_, 0);
    generation_ = offer.table.generation();
  }
  if (const auto refused = refusal(offer)) {
    writers_.lost(writers_.numberOf(refused->writer), refused->reason);
    ++refusals_;
    return false;
  }
  recentPair(offer) = offer.pair();
  return true;
}

// What the rows of an object take at most, for rows are what a neighbour can make large: one object
// must not take at once what is kept for others. A bundle's identifier and an override of it are
// not known yet; they are charged with the rest. Only an object that is marked for telemetry can be
// reported.
uint64_t Shares::spaceOf(const ObjectOffer& offer) const {
  if (limits_[kRowBytes] == kNoLimit || !offer.telemetryEnabled()) return 1;
  size_t name = 0;
  size_t payload = kBesideTexts;
  for (const FieldKind kind : {FieldKind::subsystem, FieldKind::category, FieldKind::name}) {
    const FieldToken token = tokenOf(offer.end, kind);
    name += replaceInvalidUtf8(offer.table.text(token).textOr("")).size();
    payload += jsonSize(offer, token);
  }
  payload += jsonSize(offer, tokenOf(offer.begin, FieldKind::processName)) +
             jsonSize(offer, tokenOf(offer.end, FieldKind::processName));
  for (const FieldKind kind : kArguments) {
    payload += std::max(jsonSize(offer, tokenOf(offer.begin, kind)),
                        jsonSize(offer, tokenOf(offer.end, kind)));
  }
  return spaceOfRow_(payload) + spaceOfRow_(payload + name);
}

// What an object costs in time shows only afterwards, so 1 stands for it here. One object overdraws
// that share by little. The process remembers the executables of reported objects only. A pair is
// held by whoever brought it first, and then serves everybody.
std::optional<Shares::Refusal> Shares::refusal(const ObjectOffer& offer) {
  const Origin writer = offer.writer();
  if (!mayTake(kTime, 1, writer)) return Refusal{LossCode::beyondTimeLimit, writer};
  if (!mayTake(kRowBytes, spaceOf(offer), writer))
    return Refusal{LossCode::beyondTextLimit, writer};
  if (offer.telemetryEnabled()) {
    const Origin beginner = writerOf(offer.table, offer.begin);
    if (!imageIsAdmitted(offer.table, offer.images()[0], beginner))
      return Refusal{LossCode::beyondImageLimit, beginner};
    if (!imageIsAdmitted(offer.table, offer.images()[1], writer))
      return Refusal{LossCode::beyondImageLimit, writer};
  }
  const Key pair{offer.subsystem().hash(), offer.category().hash()};
  const size_t bytes = sizeOf(offer.subsystem()) + sizeOf(offer.category());
  if (!hasOrTakes(pairs_, pair, bytes, kPairs, kPairBytes, writer))
    return Refusal{LossCode::beyondPairLimit, writer};
  return std::nullopt;
}

bool Shares::imageIsAdmitted(TracePointTable& table, FieldToken image, const Origin& writer) {
  if (table.noted(image)) return true;
  const StringRef path = table.text(image);
  if (!hasOrTakes(images_, {path.hash(), 0}, sizeOf(path), kImages, kImageBytes, writer))
    return false;
  table.note(image);
  return true;
}

bool Shares::hasOrTakes(Admitted& admitted, Key key, uint64_t bytes, Kind count, Kind text,
                        const Origin& origin) {
  // Both hashes are seeded, so the sum needs no seed. The odd factor keeps pairs of two equal
  // texts, and pairs whose texts change places, apart.
  const auto hash = static_cast<uint32_t>(key.first + key.second * 0x9e3779b97f4a7c15u);
  const auto isKey = [&](uint32_t number) { return admitted.keys[number] == key; };
  if (admitted.index.find(hash, isKey) != FlatIndex::kNone) return true;
  if (!mayTake(count, 1, origin) || !mayTake(text, bytes, origin)) return false;
  const uint32_t writer = writers_.numberOf(origin);
  take(count, 1, writer);
  take(text, bytes, writer);
  admitted.index.add(hash, static_cast<uint32_t>(admitted.keys.size()));
  admitted.keys.push_back(key);
  return true;
}

bool Shares::admitsCounter(const Origin& origin) {
  if (!mayTake(kCounters, 1, origin)) return false;
  take(kCounters, 1, writers_.numberOf(origin));
  return true;
}

// The rule, first among users and then among the programs of one. A user who holds little gets what
// there is, so the programs of one user are weighed only against one another.
bool Shares::mayTakeScarce(Kind kind, uint64_t amount, const Origin& origin) {
  const uint64_t after = given_[kind] + amount;
  if (after > limits_[kind]) return false;
  const uint32_t writer = writers_.numberOf(origin);
  const uint32_t user = writers_.userOf(writer);
  const auto heldBy = [kind](const std::vector<Amounts>& all, uint32_t number) {
    return number < all.size() ? all[number][kind] : 0;
  };
  if (heldBy(byUser_, user) + amount <= sixteenth(limits_[kind])) return true;
  const uint64_t openToUsers = threeQuarters(limits_[kind]);
  return after <= openToUsers && heldBy(byWriter_, writer) + amount <= sixteenth(openToUsers);
}

void Shares::take(Kind kind, uint64_t amount, uint32_t writer) {
  const uint32_t user = writers_.userOf(writer);
  if (byWriter_.size() <= writer) byWriter_.resize(writers_.size());
  if (byUser_.size() <= user) byUser_.resize(writers_.users());
  given_[kind] += amount;
  byUser_[user][kind] += amount;
  byWriter_[writer][kind] += amount;
  // A user holds what his programs hold, and nobody holds what was not given away.
  TESSEL_INVARIANT(byWriter_[writer][kind] <= byUser_[user][kind] &&
                   byUser_[user][kind] <= given_[kind]);
}

// A machine that was asleep during one delivery must not cost everybody the rest of the run. So one
// delivery costs its writer at most the sixteenth that ends his claim to what is scarce.
void Shares::charge(const Origin& origin, uint64_t rowBytes, uint64_t nanoseconds) {
  const uint32_t writer = writers_.numberOf(origin);
  take(kRowBytes, rowBytes, writer);
  take(kTime, std::min(nanoseconds, sixteenth(limits_[kTime])), writer);
  noteScarcity();
}

}  // namespace tessel
