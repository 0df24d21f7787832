// Number and Payload: what an analytics event carries.
//
// Both are plain values. A payload is completed on one thread and then shared unchanged.

#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/Json.h"
#include "platform/SharedString.h"

namespace tessel {

// A number that keeps its kind from the recording application to the event. Booleans are numbers; a
// 32-bit float stays one; an unsigned 64-bit number never passes through a double.
using Number = std::variant<bool, int64_t, uint64_t, float, double>;

// False for false, 0 and 0.0; true for every other number.
bool booleanValue(const Number& number);
// The number as JSON has it: the shortest decimal text that reads back as the same number of its
// kind, "true" or "false" for a boolean, "null" for a number that is not finite.
std::string numberText(const Number& number);

// A flat dictionary: keys to strings or numbers, in the order in which the keys were first set.
class Payload {
 public:
  using Value = std::variant<SharedString, Number>;
  // Keys are literals: the views given to set() must outlive the payload.
  using Entry = std::pair<std::string_view, Value>;

  // Storing an absent string leaves the key out, or as it was.
  void set(std::string_view key, SharedString value);
  void set(std::string_view key, Number value);
  // The value under `key`; null where there is none.
  const Value* find(std::string_view key) const;
  const std::vector<Entry>& entries() const { return entries_; }

 private:
  void store(std::string_view key, Value value);

  std::vector<Entry> entries_;
};

// The payload as one JSON object, keys in payload order. Bytes of a string that are not
// valid UTF-8 become U+FFFD, one for each maximal invalid part.
std::string payloadJson(const Payload& payload, JsonStyle style = {});

}  // namespace tessel
