// Looking a field up by its name, and decimal numbers.

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

// An export file asks this about every field of every entry, and most fields are no trace point's.
// The prefix tells that before any name is compared.
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
  // The cast of a double that no float can hold is undefined.
  if (!real || std::fabs(*real) > double{std::numeric_limits<float>::max()}) return std::nullopt;
  return static_cast<float>(*real);
}

}  // namespace tessel
