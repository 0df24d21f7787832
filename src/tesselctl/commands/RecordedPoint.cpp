// The rules for fields are those of the reader: its own limits and number parsers are used here, so
// that the two cannot disagree.

#include "tesselctl/commands/RecordedPoint.h"

#include <algorithm>

#include "journal/EntryStream.h"
#include "trace/DecimalNumber.h"
#include "trace/IntervalAssembler.h"

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
  void add(const std::string& name, const std::optional<std::string>& value) {
    if (value) add(name, *value);
  }
  // Each LABEL=VALUE as the two fields of its slot, such as TESSEL_STRING1_NAME and ..._VALUE.
  template <size_t N>
  void addSlots(const std::string& kind, const std::array<std::optional<std::string>, N>& pairs,
                bool number) {
    for (size_t slot = 0; slot < N; ++slot)
      addSlot(kind + std::to_string(slot + 1), pairs[slot], number);
  }
  void addSlot(const std::string& slot, const std::optional<std::string>& pair, bool number) {
    if (!pair) return;
    const size_t equals = pair->find('=');
    if (equals == std::string::npos) return complain("'" + *pair + "' is not LABEL=VALUE");
    const std::string value = pair->substr(equals + 1);
    if (number && !parseDecimal(value)) return complain("'" + value + "' is no decimal number");
    add("TESSEL_" + slot + "_NAME", pair->substr(0, equals));
    add("TESSEL_" + slot + "_VALUE", value);
  }
  void addDecimal(const std::string& name, const std::optional<std::string>& value) {
    if (value && !parseFloat(*value)) return complain("'" + *value + "' is no decimal number");
    add(name, value);
  }
  void addAttributes(const std::vector<std::string>& attributes) {
    if (attributes.size() > kMaxAttributes) {
      complain("more than " + std::to_string(kMaxAttributes) + " attributes");
    }
    for (const std::string& attribute : attributes) {
      const size_t equals = attribute.find('=');
      if (equals == 0 || equals == std::string::npos) {
        return complain("'" + attribute + "' is not KEY=VALUE");
      }
      add("TESSEL_ATTRIBUTE", attribute);
    }
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
};

}  // namespace

std::variant<std::vector<RecordedField>, std::string> fieldsOf(const RecordedPoint& point,
                                                               const std::string& kind) {
  FieldList list;
  list.add("MESSAGE", point.message);
  list.add("TESSEL_KIND", kind);
  list.add("TESSEL_SUBSYSTEM", point.subsystem);
  list.add("TESSEL_CATEGORY", point.category);
  list.add("TESSEL_NAME", point.name);
  list.add("TESSEL_INTERVAL_ID", point.id);
  list.add("TESSEL_INTERVAL_SCOPE", point.scope);
  if (point.telemetry) list.add("TESSEL_TELEMETRY", std::string("1"));
  list.addSlots("STRING", point.strings, false);
  list.addSlots("NUMBER", point.numbers, true);
  list.addDecimal("TESSEL_DURATION", point.duration);
  list.addDecimal("TESSEL_FRAME_RATE", point.frameRate);
  list.addAttributes(point.attributes);
  for (const std::string& field : point.fields) list.addOther(field);
  return std::move(list).result();
}

}  // namespace tessel::ctl
