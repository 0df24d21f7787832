// Parses single fields and starts the generations of the table.

#include "trace/TracePointTable.h"

#include <algorithm>
#include <charconv>
#include <tuple>

#include "platform/Invariant.h"

namespace tessel {

namespace {

// The assembler checks the limit between two entries, so one entry may exceed it. This is room for
// the values of such an entry. An entry with more values makes the vector move, which only costs
// time.
constexpr size_t kRoomForOneEntry = 4096;

}  // namespace

TracePointTable::TracePointTable(TracePointTableLimits limits)
    : limits_(limits), contents_(emptyContents(limits)) {}

TracePointTable::Contents TracePointTable::emptyContents(const TracePointTableLimits& limits) {
  Contents contents;
  // We reserve everything at once, so the vector need not move. Pages that nobody touches cost
  // nothing.
  contents.fields.reserve(limits.fields + kRoomForOneEntry);
  contents.fields.emplace_back();  // the value of kNoToken: no text, no number, identity 0
  contents.fields.back().noted = true;
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

// Every field that makes an entry a trace point begins like this, and so do most others of it. So a
// damaged field hides no trace point.
std::vector<std::string_view> TracePointTable::marks() const { return {"TESSEL_"}; }

bool TracePointTable::wants(std::string_view fieldName) const {
  return journalFieldNamed(fieldName) != nullptr;
}

FieldToken TracePointTable::tokenFor(std::string_view name, std::string_view value, uint64_t size) {
  const JournalField* field = journalFieldNamed(name);
  if (field == nullptr) return kNoToken;
  if (size <= kMaxFieldValueLength) return parse(*field, value);
  // The daemon adds the fields that begin with an underscore. If such a value is too long, the
  // writer is not to blame, so the trace point counts without the field.
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
    case ValueForm::recurring:
      return parseNumber(field, value);
    case ValueForm::attribute: {
      const size_t equals = value.find('=');
      if (equals == 0 || equals == std::string_view::npos) break;
      return addAttribute(value.substr(0, equals), value.substr(equals + 1));
    }
  }
  return malformedToken(kind, *field.whenBad);
}

// Most numbers occur in one entry only, so we add them without a search for an equal one. Numbers
// of processes and users recur. Pairing also compares the tokens of processes, so equal ones must
// have equal tokens.
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
  return field.form == ValueForm::recurring ? addOnce(parsed) : add(parsed);
}

// Most ids are numbers that only one begin and one end have. To intern their texts would fill the
// pool for nothing, so we store a number n as 2n + 1. The identity of a text is the address of its
// record, which is even, so a number and a text never have the same identity. The ids "07" and "7"
// must stay different, so a number with a leading zero is stored as a text. 18 digits are the limit
// because 2n + 1 must fit 64 bits.
FieldToken TracePointTable::parseIdentifier(FieldKind kind, std::string_view value) {
  constexpr size_t kMostDigits = 18;
  uint64_t number = 0;
  const char* const last = value.data() + value.size();
  const auto [end, error] = std::from_chars(value.data(), last, number);
  const bool usual =
      error == std::errc() && end == last && value.front() != '0' && value.size() <= kMostDigits;
  return usual ? add(wholeField(kind, number * 2 + 1)) : textToken(kind, value);
}

// We add an attribute each time without a search for an equal one, because the assembler compares
// attributes by key and never by token.
FieldToken TracePointTable::addAttribute(std::string_view key, std::string_view value) {
  contents_.attributes.emplace_back(contents_.strings->intern(key),
                                    contents_.strings->intern(value));
  return add(wholeField(FieldKind::attribute, contents_.attributes.size() - 1));
}

// The pool must look up the text anyway. So it keeps a note beside each string: the token of the
// first kind of field that had this text. Few texts occur in fields of a second kind; the index
// finds the tokens of those.
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
  TESSEL_INVARIANT(index >> kIndexBits == 0);  // otherwise two values would share a token
  return static_cast<FieldToken>(field.kind) << kIndexBits | static_cast<FieldToken>(index);
}

// We compare the form too, because the signed -1 and the greatest unsigned number have the same
// bits. The hash leaves kind and form out: few values have several of them, and the comparison
// tells these apart.
FieldToken TracePointTable::addOnce(const Field& field) {
  const uint32_t hash = hashWords(field.identity());
  const auto isField = [&](FieldToken token) {
    return kind(token) == field.kind && at(token).form == field.form &&
           at(token).identity() == field.identity();
  };
  return contents_.index.findOrAdd(hash, isField, [&] { return add(field); });
}

// We intern the 16 bytes of a boot id like a text, so that pairing can compare boots by token. Most
// entries have the boot of the entry before, so we compare with that one before we hash.
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

// A double holds every number nearly. Where two numbers are equal in it, their forms and their bits
// decide, so that the answer never depends on the order of the tokens.
bool TracePointTable::isGreater(FieldToken token, FieldToken other) const {
  const Field& a = at(token);
  const Field& b = at(other);
  if (a.form == Form::text && b.form == Form::text)
    return StringRef(a.record).text() > StringRef(b.record).text();
  if (a.form == Form::text || b.form == Form::text) return a.form == Form::text;
  const auto key = [](const Field& field) {
    const double value = field.form == Form::fraction ? field.fraction
                         : field.form == Form::real   ? double{field.real}
                         : field.form == Form::unsignedWhole
                             ? static_cast<double>(field.whole)
                             : static_cast<double>(static_cast<int64_t>(field.whole));
    return std::tuple(value, field.form, field.whole);
  };
  return key(a) > key(b);
}

PointKind TracePointTable::pointKind(FieldToken token) const {
  return static_cast<PointKind>(at(token).whole);
}

MalformedReason TracePointTable::malformedReason(FieldToken token) const {
  return static_cast<MalformedReason>(at(token).whole & ~kMalformedRequired);
}

// Readers see by the number that their cached tokens are invalid. The number wraps around after
// four thousand million generations. That does no harm, because a reader compares it with the last
// one.
TracePointTable::Renewal TracePointTable::startGeneration() {
  ++generation_;
  lastBootToken_ = kNoToken;
  return {*this, std::exchange(contents_, emptyContents(limits_))};
}

// Many intervals hold the same token. The first exchange stores the new token in the old table, so
// each value is added to the new table only once.
FieldToken TracePointTable::Renewal::renewed(FieldToken old) {
  if (old == kNoToken) return kNoToken;
  Field& field = old_.fields[indexOf(old)];
  // A token of an even earlier generation would stand for another value here.
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
  // We add numbers and numeric ids without a search, as parse() does.
  const ValueForm form = journalField(old.kind).form;
  const bool once =
      form == ValueForm::word || form == ValueForm::flag || form == ValueForm::recurring;
  return once ? table_.addOnce(old) : table_.add(old);
}

}  // namespace tessel
