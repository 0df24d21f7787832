// Looks up fields by name and parses decimal numbers.

#include "trace/TracePointFields.h"

#include <algorithm>
#include <charconv>
#include <cmath>

namespace tessel {

namespace {

template <typename T>
std::optional<T> parseWhole(std::string_view text) {
  T value{};
  const char* end = text.data() + text.size();
  const auto [at, error] = std::from_chars(text.data(), end, value);
  if (error != std::errc() || at != end) return std::nullopt;
  return value;
}

// Whether a decimal is less than 1: whether its first digit that is not zero has a negative power
// of ten. from_chars() says "out of range" for 1e-400 and for 1e400 alike, and this tells which.
bool isBelowOne(std::string_view decimal) {
  const std::string_view digits = decimal.substr(0, decimal.find_first_of("eE"));
  std::string_view power = decimal.substr(std::min(digits.size() + 1, decimal.size()));
  if (power.starts_with('+')) power.remove_prefix(1);
  const auto exponent = power.empty() ? 0 : parseWhole<int64_t>(power);
  if (!exponent) return power.starts_with('-');  // an exponent that no integer holds
  const auto first = static_cast<int64_t>(digits.find_first_of("123456789"));
  const auto point = static_cast<int64_t>(std::min(digits.find('.'), digits.size()));
  return *exponent < (first < point ? first - point + 1 : first - point);
}

// Parsed at once as T: a decimal that became a double first would be rounded twice.
template <typename T>
std::optional<T> parseReal(std::string_view text) {
  T value{};
  const char* end = text.data() + text.size();
  const auto [at, error] = std::from_chars(text.data(), end, value);
  if (at != end || !std::isfinite(value)) return std::nullopt;
  if (error == std::errc()) return value;
  if (error != std::errc::result_out_of_range || !isBelowOne(text)) return std::nullopt;
  return text.starts_with('-') ? -T{0} : T{0};
}

}  // namespace

// The reader of export files calls this for every field of every entry, and most of these fields do
// not belong to a trace point. The check of the prefix saves comparing their names with all rows.
const JournalField* journalFieldNamed(std::string_view name) {
  if (!name.starts_with('_') && !name.starts_with("TESSEL_")) return nullptr;
  const auto* field = std::ranges::find(kJournalFields, name, &JournalField::name);
  return field == std::end(kJournalFields) ? nullptr : field;
}

std::optional<Number> parseDecimal(std::string_view text) {
  if (const auto whole = parseWhole<int64_t>(text)) return *whole;
  if (const auto whole = parseWhole<uint64_t>(text)) return *whole;
  if (const auto real = parseReal<double>(text)) return *real;
  return std::nullopt;
}

std::optional<float> parseFloat(std::string_view text) { return parseReal<float>(text); }

}  // namespace tessel
