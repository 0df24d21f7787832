// Boolean value and text of a Number.

#include "platform/Number.h"

#include <charconv>
#include <cmath>
#include <type_traits>

namespace tessel {

bool booleanValue(const Number& number) {
  return std::visit([](auto value) { return value != decltype(value){}; }, number);
}

std::string numberText(const Number& number) {
  return std::visit(
      [](auto value) -> std::string {
        using Value = decltype(value);
        if constexpr (std::is_same_v<Value, bool>) {
          return value ? "true" : "false";
        } else {
          if constexpr (std::is_floating_point_v<Value>) {
            if (!std::isfinite(value)) return "null";
          }
          char buffer[64];
          const auto end = std::to_chars(buffer, buffer + sizeof buffer, value);
          return {buffer, end.ptr};
        }
      },
      number);
}

}  // namespace tessel
