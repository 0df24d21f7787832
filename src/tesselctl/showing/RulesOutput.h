// RulesOutput: the rules of the build, and the answer to whether something would pass, as text for
// people, lines for scripts, JSON, and a page of markdown.
//
// Nothing here decides: the answers come from the filter of the service. Stateless; any thread.

#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "tesselctl/judging/Judge.h"
#include "tesselctl/showing/Terminal.h"
#include "whitelist/PlatformProfile.h"

namespace tessel::ctl {

// --- Searching the lists, to show which one decided.

using ListRows = std::vector<const StringListRow*>;

// The rows of these lists, in the order of stringLists().
ListRows listRows(std::span<const StringListSource> lists);
// The row with `value`; null if no list holds it. No value stands in two lists.
const StringListRow* listWith(const ListRows& rows, std::string_view value);
// A few values that the writer of an unknown one may have meant: they differ in case, or one begins
// with the other.
std::vector<std::string_view> nearValues(const ListRows& rows, std::string_view value);

// --- The answer to a check.

struct StringAnswer {
  size_t slot = 0;       // from 1
  bool present = false;  // the trace point has the string; label and value are empty if not
  std::string label;
  std::string value;
  ListRows allowed;                         // the lists on which the value may stand
  const StringListRow* list = nullptr;      // the one on which it does; null if on none
  std::vector<std::string_view> near;       // set if it is on none, as is the next
  std::vector<std::string_view> elsewhere;  // platforms that know the value
};

struct CheckAnswer {
  JudgedMachine machine;
  bool passes = false;
  std::string_view verdict;       // the service's
  std::vector<std::string> path;  // subsystem, category, name; empty: a value was asked for
  std::vector<StringAnswer> strings;
  size_t failedSlot = 0;  // from 1; 0 if no string failed
  bool special = false;   // the rule for performance logging failed it
  struct Downsampling {
    std::string scope;
    uint64_t cap;
    uint64_t ratio;
  };
  std::optional<Downsampling> downsampling;  // absent: no row covers the path
};

std::string checkText(const CheckAnswer& answer, const Terminal& terminal);
std::string checkJson(const CheckAnswer& answer);

// --- All rules.

// One record a line: the platforms, then what the profile knows.
std::string rulesLines(const PlatformProfile& profile, bool json);
// The same for people.
std::string rulesText(const PlatformProfile& profile, bool internal, const Terminal& terminal);
// A page with the rules of all platforms.
std::string rulesMarkdown();

}  // namespace tessel::ctl
