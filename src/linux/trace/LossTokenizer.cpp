#include "linux/trace/LossTokenizer.h"

#include <algorithm>
#include <charconv>

namespace tessel {

namespace {

constexpr std::string_view kMessageId = "MESSAGE_ID";
constexpr std::string_view kCount = "N_DROPPED";
constexpr std::string_view kUnit = "OBJECT_SYSTEMD_UNIT";
constexpr std::string_view kLossMessage = "a596d6fe7bfa4994828e72309e95d61e";

// The message, then the counts, then the units.
constexpr FieldToken kLossToken = kFirstReservedToken;
constexpr FieldToken kFirstCount = kFirstReservedToken + 1;
constexpr FieldToken kFirstUnit = kFirstReservedToken + 0x40000000;

bool isOurs(FieldToken token) { return token >= kFirstReservedToken; }

}  // namespace

bool LossTokenizer::wants(std::string_view fieldName) const {
  return user_.wants(fieldName) || fieldName == kMessageId || fieldName == kCount ||
         fieldName == kUnit;
}

FieldToken LossTokenizer::tokenFor(std::string_view field, std::string_view value, uint64_t size) {
  if (field == kMessageId && value == kLossMessage) {
    met_ = true;
    return kLossToken;
  }
  if (field == kCount) return valueToken(value, counts_, kFirstCount);
  if (field == kUnit) return valueToken(value, units_, kFirstUnit);
  return user_.tokenFor(field, value, size);
}

FieldToken LossTokenizer::valueToken(std::string_view value, std::vector<std::string>& values,
                                     FieldToken first) {
  const auto known = std::find(values.begin(), values.end(), value);
  const auto index = static_cast<FieldToken>(known - values.begin());
  if (known == values.end()) {
    if (values.size() >= kMaxUnits) return kNoToken;
    values.emplace_back(value);
  }
  return first + index;
}

std::span<const FieldToken> LossTokenizer::takeOwn(std::span<const FieldToken> tokens) {
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
  std::string unit;
  for (const FieldToken token : tokens) {
    if (token == kLossToken) {
      loss = true;
    } else if (token >= kFirstUnit) {
      unit = units_[token - kFirstUnit];
    } else if (token >= kFirstCount) {
      const std::string& text = counts_[token - kFirstCount];
      std::from_chars(text.data(), text.data() + text.size(), number);
    }
  }
  if (loss) unitNamed(unit).count += number;
}

DroppedEntries& LossTokenizer::unitNamed(const std::string& unit) {
  const auto known = std::find_if(dropped_.begin(), dropped_.end(),
                                  [&](const DroppedEntries& one) { return one.unit == unit; });
  if (known != dropped_.end()) return *known;
  return dropped_.emplace_back(DroppedEntries{unit, 0});
}

}  // namespace tessel
