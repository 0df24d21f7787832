// What the fields of a trace point are called, and why an entry may be no good.

#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

namespace tessel {

// Kinds of field values. Those below `attribute` stand at most once in a trace point and have a
// slot in it; the order puts what a writer says before what the journal daemon adds.
enum class FieldKind : uint8_t {
  pointKind,
  subsystem,
  category,
  name,
  intervalId,
  scope,
  telemetry,
  string1Name,
  string1Value,
  string2Name,
  string2Value,
  number1Name,
  number1Value,
  number2Name,
  number2Value,
  duration,
  frameRate,
  imagePath,
  processName,
  process,
  attribute,
  malformed,
  boot,
};
inline constexpr size_t kPointSlots = static_cast<size_t>(FieldKind::attribute);

enum class PointKind : uint8_t { event, begin, end };

// Why an entry that means to be a trace point is not taken as one.
enum class MalformedReason : uint8_t {
  unknownKind,
  unknownScope,
  invalidDuration,
  invalidFrameRate,
  invalidAttribute,
  valueTooLong,
  tooManyAttributes,
  missingKind,
  missingSubsystem,
  missingCategory,
};
inline constexpr size_t kMalformedReasons = 10;

// Whether every trace point has a field of this kind.
constexpr bool isRequired(FieldKind kind) { return kind <= FieldKind::category; }

// In words, such as "unknown TESSEL_KIND".
std::string_view malformedReasonText(MalformedReason reason);

// The kind of the field called `name`; nothing for a field that no trace point has.
std::optional<FieldKind> fieldKindOf(std::string_view name);

}  // namespace tessel
