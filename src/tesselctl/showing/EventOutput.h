// A row of the spool, for people and for programs.
//
// Any program may have written the row, so nothing in it is trusted: what is shown is escaped, and
// a payload need not be JSON. Stateless; any thread.

#pragma once

#include <string>
#include <vector>

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
// Which time of a row a terminal shows. Fields for programs have both.
enum class RowTime { ofEvent, ofDelivery };
// One line: as wide as the terminal, or fields with tabs between. REQUIRES: the row was delivered
// if the time is that of the delivery.
std::string eventLine(const SpoolRow& row, RowTime time, const Terminal& terminal);
// The line above the rows of a terminal: the time of the first of them, with year and zone.
std::string eventHeading(const SpoolRow& first, RowTime time, const Terminal& terminal);
// All of the row, its payload laid out on many lines.
std::string wholeEvent(const SpoolRow& row, const Terminal& terminal);

// Lines that say how many rows wait, how many went where, and what was refused.
std::string eventTotals(const SpoolContents& contents, const std::vector<Delivered>& deliveries);

// Sums over rows that were chosen among those of the spool.
struct ChosenRows {
  int64_t waiting = 0;
  int64_t delivered = 0;
  std::vector<Delivered> destinations;  // the first ones met, at most eight

  void add(const SpoolRow& row);
  bool none() const { return waiting + delivered == 0; }
};
// The same lines for rows that were chosen, and behind them what the whole spool holds.
std::string chosenTotals(const ChosenRows& chosen, const SpoolContents& contents);

}  // namespace tessel::ctl
