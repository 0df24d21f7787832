// What was read of a trace store and what was lost: as JSON and as lines.
//
// The words come with the losses. Here they are laid out and made fit to be shown. Stateless; any
// thread.

#pragma once

#include <string>
#include <vector>

#include "platform/Json.h"
#include "platform/Losses.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

// That the store holds only a part of the period, without a full stop; empty where it holds all.
std::string partOfPeriod(const StoreReading& reading);

// `losses`: they are written alike wherever they are shown.
void addLosses(JsonWriter& json, const Losses& losses);
// `malformed`: reason to count.
void addMalformed(JsonWriter& json, const Losses& losses);
// `beyond_pair_limit`, `without_exe` and `store`.
void addStore(JsonWriter& json, const StoreReading& reading);
// The members of a reading as `status --json` has it.
void addReading(JsonWriter& json, const StoreReading& reading);

// A line for each loss, but of each code no more than `mostOfACode` and one for the others. The
// lines are not yet fit for a terminal.
std::vector<std::string> lossLines(const Losses& losses, size_t mostOfACode);
// All losses under a heading, fit for `terminal`; empty where there is none.
std::string lossText(const Losses& losses, const Terminal& terminal);

}  // namespace tessel::ctl
