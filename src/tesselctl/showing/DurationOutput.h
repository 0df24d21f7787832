// Durations and frame rates, as JSON and as text for people.
//
// Stateless; any thread.

#pragma once

#include <string>

#include "platform/Json.h"
#include "tesselctl/judging/Durations.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

// With three digits and the unit that suits: "12.3 ms", "1.25 h".
std::string secondsText(float seconds);
// Frames per second: "59.9 fps".
std::string frameRateText(float rate);
// The shortest digits that read back as the same value, without a unit. Programs sort and compare,
// which one unit for all values lets them do.
std::string plainDigits(float value);

// What people must know of each table and list of percentiles. The bound is that of the sketch,
// rounded up.
static_assert(QuantileSketch::kError < 0.016);
inline constexpr char kPercentileError[] = "each percentile may be up to 1.6 % too low or too high";

// Writes the members `durations` in seconds and `frame_rates` in frames per second, each with the
// count of values that it does not list.
void addDurations(JsonWriter& json, const Durations& durations);

// The trace points with most values as tables; empty where there are no values.
std::string durationText(const Durations& durations, const Terminal& terminal);

// The same two members for two periods side by side, what became slower first. REQUIRES, as of
// durationChangesText(): `b` was made to expect `a`.
void addDurationChanges(JsonWriter& json, const Durations& a, const Durations& b);
// What became slower in words, and below that the trace points; empty where there are no values.
std::string durationChangesText(const Durations& a, const Durations& b, const Terminal& terminal);

}  // namespace tessel::ctl
