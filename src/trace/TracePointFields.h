// The journal fields of a trace point. The table has one row for each field: its name, the values
// that it may have, and the reason to count if it is bad or missing. The reader of trace points and
// `tesselctl record` both use this table.
//
// To add a field, add a kind and a row here, and use it in IntervalAssembler.cpp.
//
// Constants and pure functions, for any thread.

#pragma once

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <iterator>
#include <optional>
#include <span>
#include <string_view>

#include "journal/EntryStream.h"
#include "platform/Values.h"

namespace tessel {

// What a token can stand for. A trace point has one slot for each kind before `attribute`. The
// required kinds come first, so that isRequired() is one comparison.
enum class FieldKind : uint8_t {
  pointKind,
  subsystem,
  category,
  name,
  intervalId,
  scope,
  telemetry,
  // The labelled arguments. Label and value alternate, because labelled() counts that way.
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
  user,
  sessionOwner,
  attribute,
  // What a program lost so far, and since when. They have no slot, because few entries have them
  // and no object has.
  lost,
  lostSince,
  // These two are no journal fields. `malformed` stands for a bad value of any field, `boot` for
  // the boot that the header of an entry names.
  malformed,
  boot,
};
inline constexpr size_t kPointSlots = static_cast<size_t>(FieldKind::attribute);

// The kind of a later labelled argument. `ofFirst` is the kind of the first, and the first has
// index 0: labelled(string1Value, 1) is string2Value.
constexpr FieldKind labelled(FieldKind ofFirst, size_t index) {
  return static_cast<FieldKind>(static_cast<size_t>(ofFirst) + 2 * index);
}

// In the order of kPointKindWords.
enum class PointKind : uint8_t { event, begin, end };
inline constexpr std::string_view kPointKindWords[] = {"event", "begin", "end"};
// "system" pairs a begin and an end of two processes. Its index is not 0, so
// TracePointTable::flag() is true for it.
inline constexpr std::string_view kScopeWords[] = {"process", "system"};

// The most attributes of one entry. An interval compares each attribute with all others, so this
// limit bounds the time that one entry can take.
inline constexpr size_t kMaxAttributes = 32;

// Why an entry with fields of a trace point counts as malformed. Reports list the reasons in this
// order.
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
inline constexpr std::string_view kMalformedReasonTexts[] = {
    "unknown TESSEL_KIND",
    "unknown TESSEL_INTERVAL_SCOPE",
    "TESSEL_DURATION is no number",
    "TESSEL_FRAME_RATE is no number",
    "TESSEL_ATTRIBUTE is not KEY=VALUE",
    "value over 4096 bytes",
    "more than 32 TESSEL_ATTRIBUTE",
    "missing TESSEL_KIND",
    "missing TESSEL_SUBSYSTEM",
    "missing TESSEL_CATEGORY",
};
inline constexpr size_t kMalformedReasons = std::size(kMalformedReasonTexts);
static_assert(kMalformedReasons == static_cast<size_t>(MalformedReason::missingCategory) + 1);
static_assert(kMaxFieldValueLength == 4096 && kMaxAttributes == 32);  // the texts name both

constexpr std::string_view malformedReasonText(MalformedReason reason) {
  return kMalformedReasonTexts[static_cast<size_t>(reason)];
}

// Which values a field may have.
enum class ValueForm : uint8_t {
  text,
  identifier,  // a text that only pairing looks at
  word,        // one of a few words; any other is bad
  flag,        // "1" is yes, any other text is no
  real,        // a decimal that a 32-bit float can hold; any other text is bad
  number,      // a decimal; with any other text the field counts as absent
  recurring,   // a number that many entries share
  attribute,   // KEY=VALUE with a key; any other text is bad
};

struct JournalField {
  FieldKind kind;
  std::string_view name;
  ValueForm form = ValueForm::text;
  std::optional<MalformedReason> whenBad = {};
  std::optional<MalformedReason> whenMissing = {};  // set if each trace point must have the field
  std::span<const std::string_view> words = {};
};

// One row for each kind, in the order of the kinds.
inline constexpr JournalField kJournalFields[] = {
    {FieldKind::pointKind, "TESSEL_KIND", ValueForm::word, MalformedReason::unknownKind,
     MalformedReason::missingKind, kPointKindWords},
    {FieldKind::subsystem,
     "TESSEL_SUBSYSTEM",
     ValueForm::text,
     {},
     MalformedReason::missingSubsystem},
    {FieldKind::category, "TESSEL_CATEGORY", ValueForm::text, {}, MalformedReason::missingCategory},
    {FieldKind::name, "TESSEL_NAME"},
    {FieldKind::intervalId, "TESSEL_INTERVAL_ID", ValueForm::identifier},
    {FieldKind::scope,
     "TESSEL_INTERVAL_SCOPE",
     ValueForm::word,
     MalformedReason::unknownScope,
     {},
     kScopeWords},
    {FieldKind::telemetry, "TESSEL_TELEMETRY", ValueForm::flag},
    {FieldKind::string1Name, "TESSEL_STRING1_NAME"},
    {FieldKind::string1Value, "TESSEL_STRING1_VALUE"},
    {FieldKind::string2Name, "TESSEL_STRING2_NAME"},
    {FieldKind::string2Value, "TESSEL_STRING2_VALUE"},
    {FieldKind::number1Name, "TESSEL_NUMBER1_NAME"},
    {FieldKind::number1Value, "TESSEL_NUMBER1_VALUE", ValueForm::number},
    {FieldKind::number2Name, "TESSEL_NUMBER2_NAME"},
    {FieldKind::number2Value, "TESSEL_NUMBER2_VALUE", ValueForm::number},
    {FieldKind::duration, "TESSEL_DURATION", ValueForm::real, MalformedReason::invalidDuration},
    {FieldKind::frameRate, "TESSEL_FRAME_RATE", ValueForm::real, MalformedReason::invalidFrameRate},
    {FieldKind::imagePath, "_EXE"},
    {FieldKind::processName, "_COMM"},
    {FieldKind::process, "_PID", ValueForm::recurring},
    {FieldKind::user, "_UID", ValueForm::recurring},
    {FieldKind::sessionOwner, "_SYSTEMD_OWNER_UID", ValueForm::recurring},
    {FieldKind::attribute, "TESSEL_ATTRIBUTE", ValueForm::attribute,
     MalformedReason::invalidAttribute},
    {FieldKind::lost, "TESSEL_LOST", ValueForm::recurring},
    {FieldKind::lostSince, "TESSEL_LOST_SINCE", ValueForm::recurring},
};
static_assert(std::size(kJournalFields) == static_cast<size_t>(FieldKind::malformed));
static_assert(std::ranges::all_of(kJournalFields, [](const JournalField& field) {
  return &field == &kJournalFields[static_cast<size_t>(field.kind)];
}));

// REQUIRES: `kind` is that of a journal field.
constexpr const JournalField& journalField(FieldKind kind) {
  return kJournalFields[static_cast<size_t>(kind)];
}
// The field called `name`. Null if trace points have no such field.
const JournalField* journalFieldNamed(std::string_view name);

// The number of fields that every trace point must have. The second assertion says that their rows
// come first, which isRequired() relies on.
inline constexpr size_t kRequiredFields =
    std::ranges::count_if(kJournalFields, [](const auto& field) { return !!field.whenMissing; });
static_assert(std::ranges::is_partitioned(kJournalFields,
                                          [](const auto& field) { return !!field.whenMissing; }));
constexpr bool isRequired(FieldKind kind) { return static_cast<size_t>(kind) < kRequiredFields; }

// An integer becomes an int64_t, or a uint64_t if it is too large for that. Any other decimal
// becomes the nearest double, which is 0 for "1e-400". Absent if it is beyond all doubles, and for
// all other texts, such as one with a space or a plus sign.
std::optional<Number> parseDecimal(std::string_view text);

// The nearest 32-bit float. Absent if `text` is no decimal or is beyond all floats.
std::optional<float> parseFloat(std::string_view text);

}  // namespace tessel
