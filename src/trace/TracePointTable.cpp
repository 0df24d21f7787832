// Parsing of single fields, and the generations of the table.

#include "trace/TracePointTable.h"

#include <algorithm>
#include <charconv>

#include "platform/Invariant.h"

namespace tessel {

namespace {

// Room for the values of one entry beyond the limit, which is looked at between entries only. An
// entry with more makes the table move, which costs time and nothing else.
constexpr size_t kRoomForOneEntry = 4096;

}  // namespace

TracePointTable::TracePointTable(TracePointTableLimits limits)
    : limits_(limits), contents_(emptyContents(limits)) {}

TracePointTable::Contents TracePointTable::emptyContents(const TracePointTableLimits& limits) {
  Contents contents;
  // Room for all at once: pages that are never touched cost nothing, and nothing is ever moved.
  contents.fields.reserve(limits.fields + kRoomForOneEntry);
  contents.fields.emplace_back();  // what kNoToken stands for: no text, no number, identity 0
  return contents;
}

TracePointTable::Field TracePointTable::wholeField(FieldKind kind, uint64_t value) {
  Field field;
  field.kind = kind;
  field.form = Form::whole;
  field.whole = value;
  return field;
}

FieldToken TracePointTable::malformedToken(FieldKind kind, MalformedReason reason) {
  const uint64_t required = isRequired(kind) ? kMalformedRequired : 0;
  return addOnce(wholeField(FieldKind::malformed, static_cast<uint64_t>(reason) | required));
}

// Nearly every trace point has all required fields. So a reader need only follow the list of
// entries of the first; the others are its companions.
std::vector<EntryMark> TracePointTable::marks() const {
  EntryMark mark{kJournalFields[0].name};
  for (size_t i = 1; i < kRequiredFields; ++i) mark.companions.push_back(kJournalFields[i].name);
  return {mark};
}

bool TracePointTable::wants(std::string_view fieldName) const {
  return journalFieldNamed(fieldName) != nullptr;
}

FieldToken TracePointTable::tokenFor(std::string_view name, std::string_view value, uint64_t size) {
  const JournalField* field = journalFieldNamed(name);
  if (field == nullptr) return kNoToken;
  if (size <= kMaxFieldValueLength) return parse(*field, value);
  // The daemon adds the fields with an underscore, so what is wrong with one is no fault of the
  // writer's, and the trace point goes without it.
  return name.starts_with('_') ? kNoToken
                               : malformedToken(field->kind, MalformedReason::valueTooLong);
}

FieldToken TracePointTable::parse(const JournalField& field, std::string_view value) {
  const FieldKind kind = field.kind;
  switch (field.form) {
    case ValueForm::text:
      return textToken(kind, value);
    case ValueForm::identifier:
      return parseIdentifier(kind, value);
    case ValueForm::word: {
      const auto word = std::ranges::find(field.words, value);
      if (word == field.words.end()) break;
      return addOnce(wholeField(kind, static_cast<uint64_t>(word - field.words.begin())));
    }
    case ValueForm::flag:
      return addOnce(wholeField(kind, value == "1"));
    case ValueForm::real: {
      const std::optional<float> real = parseFloat(value);
      if (!real) break;
      Field parsed = wholeField(kind, 0);
      parsed.form = Form::real;
      parsed.real = *real;
      return add(parsed);
    }
    case ValueForm::number:
    case ValueForm::process:
      return parseNumber(field, value);
    case ValueForm::attribute: {
      const size_t equals = value.find('=');
      if (equals == 0 || equals == std::string_view::npos) break;
      return addAttribute(value.substr(0, equals), value.substr(equals + 1));
    }
  }
  return malformedToken(kind, *field.whenBad);
}

// Most numbers stand in one entry alone, so they are not looked for among those that are there.
// Processes are, because pairing compares their tokens.
FieldToken TracePointTable::parseNumber(const JournalField& field, std::string_view value) {
  const std::optional<Number> number = parseDecimal(value);
  if (!number) return kNoToken;
  Field parsed = wholeField(field.kind, 0);
  if (const auto* fraction = std::get_if<double>(&*number)) {
    parsed.form = Form::fraction;
    parsed.fraction = *fraction;
  } else if (const auto* whole = std::get_if<uint64_t>(&*number)) {
    parsed.form = Form::unsignedWhole;
    parsed.whole = *whole;
  } else {
    parsed.whole = static_cast<uint64_t>(std::get<int64_t>(*number));
  }
  return field.form == ValueForm::process ? addOnce(parsed) : add(parsed);
}

// Most ids are numbers that only a begin and its end have, so interning their texts would fill the
// pool for nothing. A number n is stored as 2n + 1. The identity of a text is the address of its
// record, which is even, so the two never meet. A number in another spelling, such as "07", is a
// text: it is another id than "7". With 18 digits, 2n + 1 still fits 64 bits.
FieldToken TracePointTable::parseIdentifier(FieldKind kind, std::string_view value) {
  constexpr size_t kMostDigits = 18;
  uint64_t number = 0;
  const char* const last = value.data() + value.size();
  const auto [end, error] = std::from_chars(value.data(), last, number);
  const bool usual =
      error == std::errc() && end == last && value.front() != '0' && value.size() <= kMostDigits;
  return usual ? add(wholeField(kind, number * 2 + 1)) : textToken(kind, value);
}

// A second showing of the same attribute is added again, because attributes are compared by
// their keys and never by their tokens.
FieldToken TracePointTable::addAttribute(std::string_view key, std::string_view value) {
  contents_.attributes.emplace_back(contents_.strings->intern(key),
                                    contents_.strings->intern(value));
  return add(wholeField(FieldKind::attribute, contents_.attributes.size() - 1));
}

// The pool looks the text up anyway, so the token of the first kind of field that has it stands as
// a note beside the string. Few texts have a second kind; those are found through the index.
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
  TESSEL_INVARIANT(index >> kIndexBits == 0);  // or two values would share a token
  return static_cast<FieldToken>(field.kind) << kIndexBits | static_cast<FieldToken>(index);
}

// The form is compared too: the signed -1 and the greatest unsigned number have the same bits.
FieldToken TracePointTable::addOnce(const Field& field) {
  const uint32_t hash = hashWords(field.identity(), static_cast<uint64_t>(field.kind));
  const auto isField = [&](FieldToken token) {
    return kind(token) == field.kind && at(token).form == field.form &&
           at(token).identity() == field.identity();
  };
  return contents_.index.findOrAdd(hash, isField, [&] { return add(field); });
}

// The 16 bytes of a boot's id are interned like a text, so that pairing compares boots by token
// too. Entry after entry has the same boot, so the last one is compared before anything is hashed.
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

// Readers notice by the number. That it starts at 0 again after four thousand million generations
// does no harm: a reader compares it with the one before.
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
  // Numbers and identifiers go in without a search, as they did when they were first read.
  const ValueForm form = journalField(old.kind).form;
  const bool once =
      form == ValueForm::word || form == ValueForm::flag || form == ValueForm::process;
  return once ? table_.addOnce(old) : table_.add(old);
}

}  // namespace tessel
