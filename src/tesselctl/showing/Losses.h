// The reading of a trace store and its losses, as JSON and as lines.
//
// Each loss brings its own words. The functions here only lay them out. Stateless; any thread.

#pragma once

#include <string>
#include <vector>

#include "platform/Json.h"
#include "platform/Losses.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

// A sentence if the store holds only a part of the period, without its full stop; else empty.
std::string partOfPeriod(const StoreReading& reading);

// A sentence if a stop left a part of the period unread, without its full stop; else empty.
std::string unreadPart(const StoreReading& reading);

// What is not there without being a loss: the start of the period, numbers, files of other periods.
// Sentences without their full stops, not yet fit for a terminal.
std::vector<std::string> notesOn(const StoreReading& reading);

// Writes the member `losses`. All commands write it alike.
void addLosses(JsonWriter& json, const Losses& losses);
// Writes the member `malformed`: a count for each reason.
void addMalformed(JsonWriter& json, const Losses& losses);
// Writes the member `over_share`: what each writer lost because he had more than his share.
// `losses` has the same counts, so they must not be added up.
void addOverShare(JsonWriter& json, const Losses& losses);
// Writes the members `beyond_pair_limit`, `without_exe` and `store`.
void addStore(JsonWriter& json, const StoreReading& reading);
// The members of a reading as `status --json` has it.
void addReading(JsonWriter& json, const StoreReading& reading);

// A sentence on trace points whose program is not known, without its full stop; else empty. They
// were read and judged, so nothing of them is lost.
std::string unknownPrograms(const Losses& losses);
// Whether something is missing because of it.
inline bool isLost(LossCode code) { return code != LossCode::noImagePath; }

// One line for each loss, but for what unknownPrograms() tells. A code gets at most `mostOfACode`
// lines, and one more for all its other losses. The caller must still make the lines fit for a
// terminal.
std::vector<std::string> lossLines(const Losses& losses, size_t mostOfACode);
// All losses under a heading, and unknownPrograms(), each with an empty line before it; fit for
// `terminal`. Empty where there is none.
std::string lossText(const Losses& losses, const Terminal& terminal);

}  // namespace tessel::ctl
