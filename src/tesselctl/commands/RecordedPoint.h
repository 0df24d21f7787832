// RecordedPoint: a trace point from the command line or from a line of JSON, and the fields of its
// journal entry.
//
// Plain values; the functions are stateless.

#pragma once

#include <array>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "journal/EntryRecording.h"
#include "objects/TesselObject.h"

namespace CLI {
class App;
}

namespace tessel::ctl {

// As complaints quote what they were given.
std::string inQuotes(std::string_view text);

// A labelled string or number, the value as text.
struct Labelled {
  std::string label;
  std::string value;
};
// Splits LABEL=VALUE at the first '='; absent without one.
std::optional<Labelled> labelledFrom(const std::string& text);

// Adds an option for each slot, such as --string1 and --string2, that takes LABEL=VALUE. `slots`
// must outlive `app`.
void addSlotOptions(CLI::App& app, const std::string& name,
                    std::span<std::optional<Labelled>> slots, const std::string& what);

struct RecordedPoint {
  std::string kind = "event";  // event, begin or end
  std::string subsystem;
  std::string category;
  std::optional<std::string> name;
  std::optional<std::string> id;
  std::optional<std::string> scope;
  bool telemetry = false;
  std::array<std::optional<Labelled>, kLabelledStrings> strings;
  std::array<std::optional<Labelled>, kLabelledNumbers> numbers;
  std::optional<std::string> duration;
  std::optional<std::string> frameRate;
  std::vector<std::string> attributes;  // KEY=VALUE
  std::vector<std::string> fields;      // NAME=VALUE, any other field
  // Absent unless asked for: journalctl shows entries with a message among those of programs.
  std::optional<std::string> message;
};

// The fields of the entry. A sentence instead, where the recording header would refuse the point, a
// reader would count the entry as malformed, or the journal would drop a field without a word.
std::variant<std::vector<RecordedField>, std::string> fieldsOf(const RecordedPoint& point);

}  // namespace tessel::ctl
