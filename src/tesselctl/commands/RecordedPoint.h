// RecordedPoint: a trace point from the command line, and the fields of its journal entry.
//
// A plain value; the function is stateless.

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

// The fields of the entry of kind `kind` ("event", "begin" or "end"). A sentence instead, where a
// reader would count the entry as malformed or the journal would drop a field without a word.
std::variant<std::vector<RecordedField>, std::string> fieldsOf(const RecordedPoint& point,
                                                               const std::string& kind);

}  // namespace tessel::ctl
