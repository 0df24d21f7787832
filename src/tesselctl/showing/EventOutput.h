// A row of the spool, for people and for programs.
//
// Any program may have written the row, so nothing in it is trusted: what is shown is escaped, and
// a payload need not be JSON. Stateless; any thread.

#pragma once

#include <string>

#include "tesselctl/reading/SpoolReader.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

// Texts of the payload; empty where the payload has no such text.
struct EventPath {
  std::string subsystem;
  std::string category;
};
EventPath pathOf(const SpooledEvent& row);

// One JSON object on a line.
std::string eventJson(const SpoolRow& row);
// One line: as wide as the terminal, or fields with tabs between.
std::string eventLine(const SpoolRow& row, const Terminal& terminal);
// The line above the rows of a terminal: when the first of them was reported, with year and zone.
std::string eventHeading(const SpoolRow& first, const Terminal& terminal);
// All of the row, its payload laid out on many lines.
std::string wholeEvent(const SpoolRow& row, const Terminal& terminal);

// Lines that say how many rows wait, how many went where, and what was refused.
std::string eventTotals(const SpoolContents& contents, const std::vector<Delivered>& deliveries);

}  // namespace tessel::ctl
