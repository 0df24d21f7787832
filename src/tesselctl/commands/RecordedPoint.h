// RecordedPoint: a trace point as it is asked for on the command line, and its journal fields.

#pragma once

#include <array>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "journal/EntryRecording.h"
#include "objects/TesselObject.h"

namespace tessel::ctl {

struct RecordedPoint {
  std::string subsystem;
  std::string category;
  std::optional<std::string> name;
  std::optional<std::string> id;
  std::optional<std::string> scope;
  bool telemetry = false;
  std::array<std::optional<std::string>, kLabelledStrings> strings;  // LABEL=VALUE
  std::array<std::optional<std::string>, kLabelledNumbers> numbers;  // LABEL=VALUE
  std::optional<std::string> duration;
  std::optional<std::string> frameRate;
  std::vector<std::string> attributes;  // KEY=VALUE
  std::vector<std::string> fields;      // NAME=VALUE, any other field
  std::string message = "tessel";
};

// The fields of the entry of kind `kind`, or what is wrong with the point, in words: whatever a
// reader of the journal would count as malformed, and what the journal would drop without a word.
std::variant<std::vector<RecordedField>, std::string> fieldsOf(const RecordedPoint& point,
                                                               const std::string& kind);

}  // namespace tessel::ctl
