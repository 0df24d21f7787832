// Parsing of single fields, and the generations of the table.

#include "trace/TracePointTable.h"

#include <charconv>

#include "platform/Invariant.h"
#include "trace/DecimalNumber.h"

namespace tessel {

namespace {

// Fields that one entry may add after the limits were looked at.
constexpr size_t kRoomForOneEntry = 4096;

// A field that the daemon adds; what is wrong with one is no fault of the trace point.
bool isDaemonField(FieldKind kind) {
  return kind == FieldKind::imagePath || kind == FieldKind::processName ||
         kind == FieldKind::process;
}

}  // namespace

TracePointTable::TracePointTable(TracePointTableLimits limits)
    : limits_(limits), contents_(emptyContents(limits)) {}

TracePointTable::Contents TracePointTable::emptyContents(const TracePointTableLimits& limits) {
  Contents contents;
  // Room for all at once: pages that are never touched cost nothing, and nothing is ever moved.
  contents.fields.reserve(limits.fields + kRoomForOneEntry);
  contents.fields.emplace_back();
  return contents;
}

TracePointTable::Field TracePointTable::wholeField(FieldKind kind, uint64_t value) {
  Field field;
  field.kind = kind;
  field.form = Form::whole;
  field.whole = value;
  return field;
}

TracePointTable::Field TracePointTable::malformedField(FieldKind kind, MalformedReason reason) {
  const uint64_t required = isRequired(kind) ? kMalformedRequired : 0;
  return wholeField(FieldKind::malformed, static_cast<uint64_t>(reason) | required);
}

std::vector<EntryMark> TracePointTable::marks() const {
  return {{"TESSEL_KIND", {}, {"TESSEL_SUBSYSTEM", "TESSEL_CATEGORY"}}};
}

bool TracePointTable::wants(std::string_view fieldName) const {
  return fieldKindOf(fieldName).has_value();
}

FieldToken TracePointTable::tokenFor(std::string_view field, std::string_view value,
                                     uint64_t size) {
  const std::optional<FieldKind> kind = fieldKindOf(field);
  if (!kind) return kNoToken;
  if (size > kMaxFieldValueLength) {
    return isDaemonField(*kind) ? kNoToken
                                : addOnce(malformedField(*kind, MalformedReason::valueTooLong));
  }
  return parse(*kind, value);
}

FieldToken TracePointTable::parse(FieldKind kind, std::string_view value) {
  switch (kind) {
    case FieldKind::pointKind:
      if (value == "event") return addOnce(wholeField(kind, uint64_t(PointKind::event)));
      if (value == "begin") return addOnce(wholeField(kind, uint64_t(PointKind::begin)));
      if (value == "end") return addOnce(wholeField(kind, uint64_t(PointKind::end)));
      return addOnce(malformedField(kind, MalformedReason::unknownKind));
    case FieldKind::scope:
      if (value == "process" || value == "system")
        return addOnce(wholeField(kind, value == "system"));
      return addOnce(malformedField(kind, MalformedReason::unknownScope));
    case FieldKind::telemetry:
      return addOnce(wholeField(kind, value == "1"));
    case FieldKind::intervalId:
      return parseId(value);
    case FieldKind::attribute:
      return parseAttribute(value);
    case FieldKind::number1Value:
    case FieldKind::number2Value:
    case FieldKind::duration:
    case FieldKind::frameRate:
    case FieldKind::process:
      return parseNumber(kind, value);
    default:
      return textToken(kind, value);
  }
}

FieldToken TracePointTable::parseNumber(FieldKind kind, std::string_view value) {
  Field field = wholeField(kind, 0);
  if (kind == FieldKind::duration || kind == FieldKind::frameRate) {
    const std::optional<float> real = parseFloat(value);
    if (!real) {
      return addOnce(malformedField(kind, kind == FieldKind::duration
                                              ? MalformedReason::invalidDuration
                                              : MalformedReason::invalidFrameRate));
    }
    field.form = Form::real;
    field.real = *real;
    return add(field);
  }
  const std::optional<Number> number = parseDecimal(value);
  if (!number) return kNoToken;
  if (const auto* fraction = std::get_if<double>(&*number)) {
    field.form = Form::fraction;
    field.fraction = *fraction;
  } else if (const auto* whole = std::get_if<uint64_t>(&*number)) {
    field.form = Form::unsignedWhole;
    field.whole = *whole;
  } else {
    field.whole = static_cast<uint64_t>(std::get<int64_t>(*number));
  }
  return kind == FieldKind::process ? addOnce(field) : add(field);
}

// Most ids are numbers that two entries have, so their texts are not worth keeping. A number as it
// is usually spelled stands for itself; being odd, its identity is that of no text.
FieldToken TracePointTable::parseId(std::string_view value) {
  constexpr size_t kMostDigits = 18;
  uint64_t number = 0;
  const auto [end, error] = std::from_chars(value.data(), value.data() + value.size(), number);
  if (value.empty() || value.front() == '0' || value.size() > kMostDigits || error != std::errc() ||
      end != value.data() + value.size())
    return textToken(FieldKind::intervalId, value);
  return add(wholeField(FieldKind::intervalId, number * 2 + 1));
}

FieldToken TracePointTable::parseAttribute(std::string_view value) {
  const size_t equals = value.find('=');
  if (equals == 0 || equals == std::string_view::npos) {
    return addOnce(malformedField(FieldKind::attribute, MalformedReason::invalidAttribute));
  }
  return addAttribute(value.substr(0, equals), value.substr(equals + 1));
}

FieldToken TracePointTable::addAttribute(std::string_view key, std::string_view value) {
  contents_.attributes.emplace_back(contents_.strings->intern(key),
                                    contents_.strings->intern(value));
  return add(wholeField(FieldKind::attribute, contents_.attributes.size() - 1));
}

// The string's note is the token of the first kind of field that has this text; further kinds are
// found by the index.
FieldToken TracePointTable::textToken(FieldKind kind, std::string_view value) {
  const auto [string, note] = contents_.strings->internNoted(value);
  if (note != kNoToken && TracePointTable::kind(note) == kind) return note;
  Field field;
  field.kind = kind;
  field.form = Form::text;
  field.record = string.record();
  return note == kNoToken ? note = add(field) : addOnce(field);
}

FieldToken TracePointTable::add(const Field& field) {
  contents_.fields.push_back(field);
  const size_t index = contents_.fields.size() - 1;
  return static_cast<FieldToken>(field.kind) << kIndexBits | static_cast<FieldToken>(index);
}

FieldToken TracePointTable::addOnce(const Field& field) {
  const uint32_t hash = hashWords(field.identity(), static_cast<uint64_t>(field.kind));
  const auto isField = [&](FieldToken token) {
    return kind(token) == field.kind && at(token).identity() == field.identity();
  };
  return contents_.index.findOrAdd(hash, isField, [&] { return add(field); });
}

FieldToken TracePointTable::bootToken(const Id128& boot) {
  if (lastBootToken_ != kNoToken && boot == lastBoot_) return lastBootToken_;
  lastBoot_ = boot;
  const std::string_view bytes(reinterpret_cast<const char*>(boot.data()), boot.size());
  return lastBootToken_ = textToken(FieldKind::boot, bytes);
}

std::optional<Number> TracePointTable::number(FieldToken token) const {
  const Field& field = at(token);
  switch (field.form) {
    case Form::whole:
      return static_cast<int64_t>(field.whole);
    case Form::unsignedWhole:
      return field.whole;
    case Form::fraction:
      return field.fraction;
    default:
      return std::nullopt;
  }
}

PointKind TracePointTable::pointKind(FieldToken token) const {
  return static_cast<PointKind>(at(token).whole);
}

MalformedReason TracePointTable::malformedReason(FieldToken token) const {
  return static_cast<MalformedReason>(at(token).whole & ~kMalformedRequired);
}

TracePointTable::Renewal TracePointTable::startGeneration() {
  ++generation_;
  lastBootToken_ = kNoToken;
  return {*this, std::exchange(contents_, emptyContents(limits_))};
}

// Many intervals hold the same token. The first exchange leaves the new token in the old table, so
// that a value is interned again only once.
FieldToken TracePointTable::Renewal::renewed(FieldToken old) {
  if (old == kNoToken) return kNoToken;
  Field& field = old_.fields[indexOf(old)];
  // A token of an earlier generation would stand for another value here.
  TESSEL_INVARIANT(field.kind == kind(old));
  if (field.form != Form::forwarded) {
    field.whole = addAgain(field);
    field.form = Form::forwarded;
  }
  return static_cast<FieldToken>(field.whole);
}

FieldToken TracePointTable::Renewal::addAgain(const Field& old) {
  if (old.form == Form::text) return table_.textToken(old.kind, StringRef(old.record).text());
  if (old.kind == FieldKind::attribute) {
    const auto& [key, value] = old_.attributes[old.whole];
    return table_.addAttribute(key.text(), value.text());
  }
  const bool once = old.kind == FieldKind::process || old.kind <= FieldKind::telemetry;
  return once ? table_.addOnce(old) : table_.add(old);
}

}  // namespace tessel
