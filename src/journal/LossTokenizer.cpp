// Counts and units of lost entries as tokens.

#include "journal/LossTokenizer.h"

#include <algorithm>
#include <charconv>

namespace tessel {

namespace {

constexpr std::string_view kMessageId = "MESSAGE_ID";
constexpr std::string_view kCount = "N_DROPPED";
constexpr std::string_view kUnit = "OBJECT_SYSTEMD_UNIT";
constexpr std::string_view kLossMessage = "a596d6fe7bfa4994828e72309e95d61e";

// Our tokens: the message, then 2^30 - 1 for counts, then one for each unit. A count is its own
// token, so that no number of different counts needs memory.
constexpr FieldToken kLossToken = kFirstReservedToken;
constexpr FieldToken kFirstCount = kFirstReservedToken + 1;
constexpr FieldToken kFirstUnit = kFirstReservedToken + 0x40000000;

bool isOurs(FieldToken token) { return token >= kFirstReservedToken; }

// A greater count than a token can hold, about a billion, becomes the greatest.
FieldToken countToken(std::string_view value) {
  uint64_t number = 0;
  const auto [end, error] = std::from_chars(value.data(), value.data() + value.size(), number);
  if (error != std::errc()) return kNoToken;
  return kFirstCount +
         static_cast<FieldToken>(std::min<uint64_t>(number, kFirstUnit - 1 - kFirstCount));
}

}  // namespace

// A user without marks sees every entry, and so do we.
std::vector<EntryMark> LossTokenizer::marks() const {
  std::vector<EntryMark> marks = user_.marks();
  if (!marks.empty()) marks.push_back({kMessageId, kLossMessage});
  return marks;
}

bool LossTokenizer::wants(std::string_view fieldName) const {
  return user_.wants(fieldName) || fieldName == kMessageId || fieldName == kCount ||
         fieldName == kUnit;
}

FieldToken LossTokenizer::tokenFor(std::string_view field, std::string_view value, uint64_t size) {
  // Anyone can send this message id, so what it says is counted and shown, but decides nothing.
  if (field == kMessageId && value == kLossMessage) {
    met_ = true;
    return kLossToken;
  }
  if (field == kCount) return countToken(value);
  if (field == kUnit) return unitToken(value);
  return user_.tokenFor(field, value, size);
}

FieldToken LossTokenizer::unitToken(std::string_view name) {
  if (name.empty() || name.size() > kMaxUnitLength) return kNoToken;
  if (const auto known = unitTokens_.find(name); known != unitTokens_.end()) return known->second;
  // No token: the entry then counts under the empty name, so the sum stays right.
  if (units_.size() > kMaxUnits) return kNoToken;
  const FieldToken token = kFirstUnit + static_cast<FieldToken>(units_.size());
  units_.push_back({std::string(name), 0});
  unitTokens_.emplace(name, token);
  return token;
}

std::span<const FieldToken> LossTokenizer::takeOwn(std::span<const FieldToken> tokens) {
  // Nearly all stores have no such entry, and nearly all entries are none: one pass without a
  // branch finds out.
  if (!met_) return tokens;
  FieldToken highest = 0;
  for (const FieldToken token : tokens) highest = std::max(highest, token);
  if (!isOurs(highest)) return tokens;
  count(tokens);
  theirs_.assign(tokens.begin(), tokens.end());
  std::erase_if(theirs_, isOurs);
  return theirs_;
}

void LossTokenizer::count(std::span<const FieldToken> tokens) {
  bool loss = false;
  uint64_t number = 0;
  size_t unit = 0;
  for (const FieldToken token : tokens) {
    if (token == kLossToken) {
      loss = true;
    } else if (token >= kFirstUnit) {
      unit = token - kFirstUnit;
    } else if (token >= kFirstCount) {
      number = token - kFirstCount;
    }
  }
  if (loss) units_[unit].count += number;
}

void LossTokenizer::addDropped(Losses& losses) const {
  std::vector<DroppedEntries> units = units_;
  std::erase_if(units, [](const DroppedEntries& one) { return one.count == 0; });
  // Up to the list's own limit the order of first sight stays, which is that of the journal.
  if (units.size() > Losses::kMaxOfACode) {
    std::stable_sort(
        units.begin(), units.end(),
        [](const DroppedEntries& a, const DroppedEntries& b) { return a.count > b.count; });
  }
  for (const auto& [unit, count] : units)
    losses.add(LossCode::droppedByDaemon, "over the journal's rate limit", {unit, {}}, count);
}

}  // namespace tessel
