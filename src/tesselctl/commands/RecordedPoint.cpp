// The rules for fields are those of the recording header, and of the reader: its own limits and
// number parsers are used here, so that the two cannot disagree.

#include "tesselctl/commands/RecordedPoint.h"

#include <algorithm>
#include <span>

#include <CLI/CLI.hpp>

#include "journal/EntryStream.h"
#include "trace/TracePointTable.h"

namespace tessel::ctl {

namespace {

// The recording header refuses longer ones, so that a key stays readable in a list.
constexpr size_t kMaxAttributeKey = 64;

// "one of event, begin, end".
std::string oneOf(std::span<const std::string_view> words) {
  std::string text = "one of";
  for (const std::string_view word : words) {
    text += (word == words.front() ? " " : ", ") + std::string(word);
  }
  return text;
}

std::string expectationOf(const JournalField& field) {
  if (field.form == ValueForm::attribute) return "KEY=VALUE";
  return field.form == ValueForm::word ? oneOf(field.words) : "a decimal number";
}

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
    // A C string ends at a NUL, so no C program can record or compare such a value.
    if (value.find('\0') != std::string::npos) {
      return complain("the value of " + name + " holds a NUL character");
    }
    fields_.push_back({name, value});
  }
  // A field of trace points. The reader of the journal says whether it would take the value, so
  // what is recorded and what is read cannot come apart.
  void add(FieldKind kind, const std::optional<std::string>& value) {
    if (!value) return;
    const JournalField& field = journalField(kind);
    add(std::string(field.name), *value);
    // The reader of the service judges the value here. Rules of our own would drift from what a run
    // takes.
    const FieldToken token = reader_.tokenFor(field.name, *value, value->size());
    if (token != kNoToken && TracePointTable::kind(token) != FieldKind::malformed) return;
    complain(std::string(field.name) + ": " + inQuotes(*value) + " is not " + expectationOf(field));
  }
  // What tells trace points apart. An empty one would be an empty cell in every table.
  void addName(FieldKind kind, const std::optional<std::string>& value) {
    if (value && value->empty()) complain(std::string(journalField(kind).name) + " is empty");
    add(kind, value);
  }
  // Two fields each, such as TESSEL_STRING1_NAME and TESSEL_STRING1_VALUE.
  template <size_t N>
  void addLabelled(FieldKind name, FieldKind value,
                   const std::array<std::optional<Labelled>, N>& pairs) {
    for (size_t i = 0; i < N; ++i) {
      if (!pairs[i]) continue;
      addName(labelled(name, i), pairs[i]->label);
      addName(labelled(value, i), pairs[i]->value);
    }
  }
  void addAttributes(const std::vector<std::string>& attributes) {
    if (attributes.size() > kMaxAttributes) {
      complain("more than " + std::to_string(kMaxAttributes) + " attributes");
    }
    for (const std::string& attribute : attributes) {
      const std::string key = attribute.substr(0, attribute.find('='));
      if (key.size() > kMaxAttributeKey) {
        complain("attribute key " + inQuotes(key) + " is " + std::to_string(key.size()) +
                 " bytes long; the limit is " + std::to_string(kMaxAttributeKey));
      }
      if (key.find('\n') != std::string::npos) {
        complain("attribute key " + inQuotes(key) + " holds a line feed");
      }
      add(FieldKind::attribute, attribute);
    }
  }
  void addOther(const std::string& field) {
    const size_t equals = field.find('=');
    if (equals == std::string::npos) return complain(inQuotes(field) + " is not NAME=VALUE");
    // Names that begin with an underscore are the daemon's own: it drops those of clients.
    const std::string name = field.substr(0, equals);
    const auto valid = [](char c) {
      return (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
    };
    if (name.empty() || !std::all_of(name.begin(), name.end(), valid) || name.front() == '_' ||
        (name.front() >= '0' && name.front() <= '9')) {
      return complain(
          "the journal drops a field called " + inQuotes(name) +
          ": a name is capital letters, digits and underscores, and begins with a letter");
    }
    add(name, field.substr(equals + 1));
  }
  // Debug, unless a field said otherwise. The journal has a rate limit for each priority, so trace
  // points do not use up that of a program's own messages.
  void addPriority() {
    const bool given = std::ranges::any_of(
        fields_, [](const RecordedField& field) { return field.name == "PRIORITY"; });
    if (!given) add("PRIORITY", "7");
  }
  std::variant<std::vector<RecordedField>, std::string> result() && {
    if (!complaint_.empty()) return std::move(complaint_);
    return std::move(fields_);
  }

 private:
  void complain(std::string what) {
    // The first complaint alone: whoever corrects it calls again, and later ones often follow from
    // it.
    if (complaint_.empty()) complaint_ = std::move(what);
  }

  std::vector<RecordedField> fields_;
  std::string complaint_;
  TracePointTable reader_;
};

}  // namespace

std::string inQuotes(std::string_view text) { return "'" + std::string(text) + "'"; }

std::optional<Labelled> labelledFrom(const std::string& text) {
  const size_t equals = text.find('=');
  if (equals == std::string::npos) return std::nullopt;
  return Labelled{text.substr(0, equals), text.substr(equals + 1)};
}

void addSlotOptions(CLI::App& app, const std::string& name,
                    std::span<std::optional<Labelled>> slots, const std::string& what) {
  for (size_t slot = 0; slot < slots.size(); ++slot) {
    const std::string number = std::to_string(slot + 1);
    const auto take = [&labelled = slots[slot], option = name + number](const std::string& text) {
      labelled = labelledFrom(text);
      if (!labelled) throw CLI::ValidationError(option, "'" + text + "' is not LABEL=VALUE");
    };
    app.add_option_function<std::string>(name + number, take, what + " " + number)
        ->type_name("LABEL=VALUE");
  }
}

std::variant<std::vector<RecordedField>, std::string> fieldsOf(const RecordedPoint& point) {
  FieldList list;
  if (point.message) list.add("MESSAGE", *point.message);
  list.add(FieldKind::pointKind, point.kind);
  list.addName(FieldKind::subsystem, point.subsystem);
  list.addName(FieldKind::category, point.category);
  list.addName(FieldKind::name, point.name);
  list.add(FieldKind::intervalId, point.id);
  list.add(FieldKind::scope, point.scope);
  if (point.telemetry) list.add(FieldKind::telemetry, "1");
  list.addLabelled(FieldKind::string1Name, FieldKind::string1Value, point.strings);
  list.addLabelled(FieldKind::number1Name, FieldKind::number1Value, point.numbers);
  list.add(FieldKind::duration, point.duration);
  list.add(FieldKind::frameRate, point.frameRate);
  list.addAttributes(point.attributes);
  for (const std::string& field : point.fields) list.addOther(field);
  list.addPriority();
  return std::move(list).result();
}

}  // namespace tessel::ctl
