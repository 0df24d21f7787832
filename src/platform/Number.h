// Number: a number object that keeps its kind from end to end.

#pragma once

#include <cstdint>
#include <string>
#include <variant>

namespace tessel {

// Booleans are numbers; a 32-bit float stays one; unsigned 64-bit never passes through a double.
using Number = std::variant<bool, int64_t, uint64_t, float, double>;

// False for false, 0 and 0.0; true for every other number.
bool booleanValue(const Number& number);

// The shortest decimal text that reads back as the same number; "true" or "false" for a boolean.
// A number that is not finite is "null", which is what JSON can say of it.
std::string numberText(const Number& number);

}  // namespace tessel
