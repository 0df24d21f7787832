// Codes the fields of loss messages as tokens, and adds up what these say.

#include "journal/LossTokenizer.h"

#include <algorithm>
#include <charconv>

namespace tessel {

namespace {

constexpr std::string_view kMessageId = "MESSAGE_ID";
constexpr std::string_view kCount = "N_DROPPED";
constexpr std::string_view kUnit = "OBJECT_SYSTEMD_UNIT";
constexpr std::string_view kTransport = "_TRANSPORT";
// The id that the daemon gives its message about suppressed entries, and the transport of all that
// it writes itself. Fields that begin with an underscore come from the daemon, so nobody else can
// send this transport.
constexpr std::string_view kLossMessage = "a596d6fe7bfa4994828e72309e95d61e";
constexpr std::string_view kDaemonItself = "driver";
constexpr std::string_view kLossMark = "MESSAGE_ID=a596d6fe7bfa4994828e72309e95d61e";
constexpr std::string_view kCountMark = "N_DROPPED=";

// Our tokens: one for the message, one for the transport, then some 2^30 for counts, then one for
// each unit. The token of a count holds the count itself, so different counts take no memory.
constexpr FieldToken kLossToken = kFirstReservedToken;
constexpr FieldToken kDaemonToken = kFirstReservedToken + 1;
constexpr FieldToken kFirstCount = kFirstReservedToken + 2;
constexpr FieldToken kFirstUnit = kFirstReservedToken + 0x40000000;

bool isOurs(FieldToken token) { return token >= kFirstReservedToken; }

// A token can hold counts up to about a billion. We take a greater count for the greatest of these.
FieldToken countToken(std::string_view value) {
  uint64_t number = 0;
  const auto [end, error] = std::from_chars(value.data(), value.data() + value.size(), number);
  if (error != std::errc()) return kNoToken;
  return kFirstCount +
         static_cast<FieldToken>(std::min<uint64_t>(number, kFirstUnit - 1 - kFirstCount));
}

}  // namespace

// A user without marks sees every entry, and one mark of ours would make the readers leave out the
// rest. The count is a second mark of a loss message: if one of both is damaged, the other still
// leads the reader to the entry.
std::vector<std::string_view> LossTokenizer::marks() const {
  std::vector<std::string_view> marks = user_.marks();
  if (!marks.empty()) marks.insert(marks.end(), {kLossMark, kCountMark});
  return marks;
}

bool LossTokenizer::wants(std::string_view fieldName) const {
  return user_.wants(fieldName) || fieldName == kMessageId || fieldName == kCount ||
         fieldName == kUnit || fieldName == kTransport;
}

FieldToken LossTokenizer::tokenFor(std::string_view field, std::string_view value, uint64_t size) {
  FieldToken own = kNoToken;
  if (field == kMessageId && value == kLossMessage) own = kLossToken;
  if (field == kTransport && value == kDaemonItself) own = kDaemonToken;
  if (field == kCount) own = countToken(value);
  if (field == kUnit) own = unitToken(value);
  if (own == kNoToken) return user_.tokenFor(field, value, size);
  met_ = true;
  return own;
}

FieldToken LossTokenizer::unitToken(std::string_view name) {
  if (name.empty() || name.size() > kMaxUnitLength) return kNoToken;
  if (const auto known = unitTokens_.find(name); known != unitTokens_.end()) return known->second;
  // Without a token the loss counts under the empty name, so the sum stays right.
  if (units_.size() > kMaxUnits) return kNoToken;
  const FieldToken token = kFirstUnit + static_cast<FieldToken>(units_.size());
  units_.push_back({std::string(name), 0});
  unitTokens_.emplace(name, token);
  return token;
}

std::span<const FieldToken> LossTokenizer::takeOwn(std::span<const FieldToken> tokens) {
  // Many stores have no such field, and in the others nearly no entry has one. The greatest token
  // tells, and the loop that finds it has no branch.
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
  bool daemon = false;
  uint64_t number = 0;
  size_t unit = 0;
  for (const FieldToken token : tokens) {
    if (token == kLossToken) {
      loss = true;
    } else if (token == kDaemonToken) {
      daemon = true;
    } else if (token >= kFirstUnit) {
      unit = token - kFirstUnit;
    } else if (token >= kFirstCount) {
      number = token - kFirstCount;
    }
  }
  if (loss && daemon) units_[unit].count += number;
}

void LossTokenizer::addDropped(Losses& losses) const {
  std::vector<DroppedEntries> units = units_;
  std::erase_if(units, [](const DroppedEntries& one) { return one.count == 0; });
  // If all units fit in the list, they stay in the order in which the journal first names them.
  if (units.size() > Losses::kMaxOfACode) {
    std::stable_sort(
        units.begin(), units.end(),
        [](const DroppedEntries& a, const DroppedEntries& b) { return a.count > b.count; });
  }
  for (const auto& [unit, count] : units)
    losses.add(LossCode::droppedByDaemon, "over the journal's rate limit", {unit, {}}, count);
}

}  // namespace tessel
