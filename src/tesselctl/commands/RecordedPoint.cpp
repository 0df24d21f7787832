// The rules for fields are those of the reader: its own limits and number parsers are used here, so
// that the two cannot disagree.

#include "tesselctl/commands/RecordedPoint.h"

#include <algorithm>

#include "journal/EntryStream.h"
#include "trace/TracePointTable.h"

namespace tessel::ctl {

namespace {

// Collects fields. It keeps the first complaint only: later ones often follow from it.
class FieldList {
 public:
  void add(const std::string& name, const std::string& value) {
    if (name.size() > kMaxFieldNameLength) {
      return complain("field name " + name + " is " + std::to_string(name.size()) +
                      " bytes long; the journal drops names over " +
                      std::to_string(kMaxFieldNameLength));
    }
    // Other fields are for other readers, which have limits of their own.
    if (name.starts_with("TESSEL_") && value.size() > kMaxFieldValueLength) {
      return complain("the value of " + name + " is " + std::to_string(value.size()) +
                      " bytes long; the limit is " + std::to_string(kMaxFieldValueLength));
    }
    fields_.push_back({name, value});
  }
  // A field of trace points. The reader of the journal says whether it would take the value, so
  // what is recorded and what is read cannot come apart.
  void add(FieldKind kind, const std::optional<std::string>& value) {
    if (!value) return;
    const JournalField& field = journalField(kind);
    add(std::string(field.name), *value);
    const FieldToken token = reader_.tokenFor(field.name, *value, value->size());
    if (token != kNoToken && TracePointTable::kind(token) != FieldKind::malformed) return;
    complain("'" + *value + "' is " +
             (field.form == ValueForm::attribute ? "not KEY=VALUE" : "no decimal number"));
  }
  // Each LABEL=VALUE as two fields, such as TESSEL_STRING1_NAME and TESSEL_STRING1_VALUE.
  template <size_t N>
  void addLabelled(FieldKind name, FieldKind value,
                   const std::array<std::optional<std::string>, N>& pairs) {
    for (size_t i = 0; i < N; ++i) {
      if (!pairs[i]) continue;
      const size_t equals = pairs[i]->find('=');
      if (equals == std::string::npos) return complain("'" + *pairs[i] + "' is not LABEL=VALUE");
      add(labelled(name, i), pairs[i]->substr(0, equals));
      add(labelled(value, i), pairs[i]->substr(equals + 1));
    }
  }
  void addAttributes(const std::vector<std::string>& attributes) {
    if (attributes.size() > kMaxAttributes) {
      complain("more than " + std::to_string(kMaxAttributes) + " attributes");
    }
    for (const std::string& attribute : attributes) add(FieldKind::attribute, attribute);
  }
  void addOther(const std::string& field) {
    const size_t equals = field.find('=');
    if (equals == std::string::npos) return complain("'" + field + "' is not NAME=VALUE");
    // Names that begin with an underscore are the daemon's own: it drops those of clients.
    const std::string name = field.substr(0, equals);
    const auto valid = [](char c) {
      return (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
    };
    if (name.empty() || !std::all_of(name.begin(), name.end(), valid) || name.front() == '_' ||
        (name.front() >= '0' && name.front() <= '9')) {
      return complain(
          "the journal drops a field called '" + name +
          "': a name is capital letters, digits and underscores, and begins with a letter");
    }
    add(name, field.substr(equals + 1));
  }
  std::variant<std::vector<RecordedField>, std::string> result() && {
    if (!complaint_.empty()) return std::move(complaint_);
    return std::move(fields_);
  }

 private:
  void complain(std::string what) {
    if (complaint_.empty()) complaint_ = std::move(what);
  }

  std::vector<RecordedField> fields_;
  std::string complaint_;
  TracePointTable reader_;
};

}  // namespace

std::variant<std::vector<RecordedField>, std::string> fieldsOf(const RecordedPoint& point,
                                                               const std::string& kind) {
  FieldList list;
  list.add("MESSAGE", point.message);
  list.add(FieldKind::pointKind, kind);
  list.add(FieldKind::subsystem, point.subsystem);
  list.add(FieldKind::category, point.category);
  list.add(FieldKind::name, point.name);
  list.add(FieldKind::intervalId, point.id);
  list.add(FieldKind::scope, point.scope);
  if (point.telemetry) list.add(FieldKind::telemetry, "1");
  list.addLabelled(FieldKind::string1Name, FieldKind::string1Value, point.strings);
  list.addLabelled(FieldKind::number1Name, FieldKind::number1Value, point.numbers);
  list.add(FieldKind::duration, point.duration);
  list.add(FieldKind::frameRate, point.frameRate);
  list.addAttributes(point.attributes);
  for (const std::string& field : point.fields) list.addOther(field);
  return std::move(list).result();
}

}  // namespace tessel::ctl
