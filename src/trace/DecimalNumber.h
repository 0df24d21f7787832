// Decimal numbers as writers of trace points spell them.

#pragma once

#include <optional>
#include <string_view>

#include "platform/Values.h"

namespace tessel {

// An integer that fits 64 bits, signed or unsigned, stays one (signed where it fits both); another
// finite decimal is a double. Nothing for any other text, surrounding space and a plus sign
// included.
std::optional<Number> parseDecimal(std::string_view text);

// A finite decimal within the range of a 32-bit float.
std::optional<float> parseFloat(std::string_view text);

}  // namespace tessel
