// Looks up fields by name and parses decimal numbers.

#include "trace/TracePointFields.h"

#include <charconv>
#include <cmath>
#include <limits>

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

std::optional<double> parseFinite(std::string_view text) {
  const std::optional<double> value = parseWhole<double>(text);
  return value && std::isfinite(*value) ? value : std::nullopt;
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
  if (const auto real = parseFinite(text)) return *real;
  return std::nullopt;
}

std::optional<float> parseFloat(std::string_view text) {
  const auto real = parseFinite(text);
  // The cast below is undefined for a double outside the range of a float.
  if (!real || std::fabs(*real) > double{std::numeric_limits<float>::max()}) return std::nullopt;
  return static_cast<float>(*real);
}

}  // namespace tessel
