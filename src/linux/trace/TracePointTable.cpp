// Parsing of single fields, and the generations of the table.

#include "linux/trace/TracePointTable.h"

#include "linux/trace/DecimalNumber.h"

namespace tessel {

namespace {

// Fields that one entry may add after the limits were looked at.
constexpr size_t kRoomForOneEntry = 4096;

uint64_t hashOf(uint64_t bits, FieldKind kind) {
  uint64_t hash = (bits + static_cast<uint64_t>(kind)) * 0x9e3779b97f4a7c15u;
  hash ^= hash >> 32;
  return hash * 0xd1b54a32d192ed03u;
}

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
  contents.index.resize(64);
  return contents;
}

TracePointTable::Field TracePointTable::wholeField(FieldKind kind, uint64_t value) {
  Field field;
  field.kind = kind;
  field.form = Form::whole;
  field.whole = value;
  return field;
}

TracePointTable::Field TracePointTable::malformedField(MalformedReason reason) {
  return wholeField(FieldKind::malformed, static_cast<uint64_t>(reason));
}

bool TracePointTable::wants(std::string_view fieldName) const {
  return fieldKindOf(fieldName).has_value();
}

FieldToken TracePointTable::tokenFor(std::string_view head, uint64_t size) {
  const size_t equals = head.find('=');
  if (equals == std::string_view::npos) return kNoToken;
  const std::optional<FieldKind> kind = fieldKindOf(head.substr(0, equals));
  if (!kind) return kNoToken;
  if (size - equals - 1 > kMaxFieldValueLength) {
    return isDaemonField(*kind) ? kNoToken : addOnce(malformedField(MalformedReason::valueTooLong));
  }
  return parse(*kind, head.substr(equals + 1));
}

FieldToken TracePointTable::parse(FieldKind kind, std::string_view value) {
  switch (kind) {
    case FieldKind::pointKind:
      if (value == "event") return addOnce(wholeField(kind, uint64_t(PointKind::event)));
      if (value == "begin") return addOnce(wholeField(kind, uint64_t(PointKind::begin)));
      if (value == "end") return addOnce(wholeField(kind, uint64_t(PointKind::end)));
      return addOnce(malformedField(MalformedReason::unknownKind));
    case FieldKind::scope:
      if (value == "process" || value == "system")
        return addOnce(wholeField(kind, value == "system"));
      return addOnce(malformedField(MalformedReason::unknownScope));
    case FieldKind::telemetry:
      return addOnce(wholeField(kind, value == "1"));
    case FieldKind::attribute:
      return parseAttribute(value);
    case FieldKind::number1Value:
    case FieldKind::number2Value:
    case FieldKind::duration:
    case FieldKind::frameRate:
    case FieldKind::process:
      return parseNumber(kind, value);
    default:
      return addOnce(textField(kind, value));
  }
}

FieldToken TracePointTable::parseNumber(FieldKind kind, std::string_view value) {
  Field field = wholeField(kind, 0);
  if (kind == FieldKind::duration || kind == FieldKind::frameRate) {
    const std::optional<float> real = parseFloat(value);
    if (!real) {
      return addOnce(malformedField(kind == FieldKind::duration
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

FieldToken TracePointTable::parseAttribute(std::string_view value) {
  const size_t equals = value.find('=');
  if (equals == 0 || equals == std::string_view::npos) {
    return addOnce(malformedField(MalformedReason::invalidAttribute));
  }
  contents_.attributes.emplace_back(contents_.strings->intern(value.substr(0, equals)),
                                    contents_.strings->intern(value.substr(equals + 1)));
  return add(wholeField(FieldKind::attribute, contents_.attributes.size() - 1));
}

TracePointTable::Field TracePointTable::textField(FieldKind kind, std::string_view value) {
  Field field;
  field.kind = kind;
  field.form = Form::text;
  field.record = contents_.strings->intern(value).record();
  return field;
}

FieldToken TracePointTable::add(const Field& field) {
  contents_.fields.push_back(field);
  return static_cast<FieldToken>(contents_.fields.size() - 1);
}

FieldToken TracePointTable::addOnce(const Field& field) {
  if (contents_.indexed * 2 >= contents_.index.size()) growIndex();
  const size_t mask = contents_.index.size() - 1;
  for (size_t at = hashOf(field.identity(), field.kind) & mask;; at = (at + 1) & mask) {
    FieldToken& token = contents_.index[at];
    if (token == kNoToken) {
      ++contents_.indexed;
      return token = add(field);
    }
    const Field& known = contents_.fields[token];
    if (known.kind == field.kind && known.identity() == field.identity()) return token;
  }
}

void TracePointTable::growIndex() {
  std::vector<FieldToken> old(contents_.index.size() * 2);
  old.swap(contents_.index);
  const size_t mask = contents_.index.size() - 1;
  for (const FieldToken token : old) {
    if (token == kNoToken) continue;
    const Field& field = contents_.fields[token];
    size_t at = hashOf(field.identity(), field.kind) & mask;
    while (contents_.index[at] != kNoToken) at = (at + 1) & mask;
    contents_.index[at] = token;
  }
}

FieldToken TracePointTable::bootToken(const Id128& boot) {
  if (lastBootToken_ != kNoToken && boot == lastBoot_) return lastBootToken_;
  lastBoot_ = boot;
  const std::string_view bytes(reinterpret_cast<const char*>(boot.data()), boot.size());
  return lastBootToken_ = addOnce(textField(FieldKind::boot, bytes));
}

std::optional<Number> TracePointTable::number(FieldToken token) const {
  const Field& field = contents_.fields[token];
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
  return static_cast<PointKind>(contents_.fields[token].whole);
}

MalformedReason TracePointTable::malformedReason(FieldToken token) const {
  return static_cast<MalformedReason>(contents_.fields[token].whole);
}

// Whether the table holds more than its limits divided by `share`.
bool TracePointTable::holds(size_t share) const {
  return contents_.fields.size() + contents_.attributes.size() > limits_.fields / share ||
         contents_.strings->memoryUsed() > limits_.textBytes / share;
}

bool TracePointTable::hasRoomForRenewal() const { return !holds(2); }

void TracePointTable::beginEntry() {
  if (!holds(1)) return;
  ++generation_;
  lastBootToken_ = kNoToken;
  Contents old = std::exchange(contents_, emptyContents(limits_));
  if (holder_ == nullptr) return;
  old_ = &old;
  holder_->renewTokens(*this);
  old_ = nullptr;
}

// Leaves a forwarding note in the old table, so that what many hold is renewed once.
FieldToken TracePointTable::renewed(FieldToken old) {
  if (old == kNoToken) return kNoToken;
  Field& field = old_->fields[old];
  if (field.form != Form::forwarded) {
    const Field fresh = renewedField(field);
    field.whole = fresh.form == Form::text || fresh.kind == FieldKind::process ||
                          fresh.kind <= FieldKind::telemetry
                      ? addOnce(fresh)
                      : add(fresh);
    field.form = Form::forwarded;
  }
  return static_cast<FieldToken>(field.whole);
}

TracePointTable::Field TracePointTable::renewedField(const Field& field) {
  if (field.form == Form::text) return textField(field.kind, StringRef(field.record).text());
  if (field.kind != FieldKind::attribute) return field;
  const auto& [key, value] = old_->attributes[field.whole];
  contents_.attributes.emplace_back(contents_.strings->intern(key.text()),
                                    contents_.strings->intern(value.text()));
  return wholeField(FieldKind::attribute, contents_.attributes.size() - 1);
}

}  // namespace tessel
