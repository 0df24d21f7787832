// Payload: the flat dictionary that an analytics event carries.
//
// String keys to strings or numbers, in the order in which they were first set. Storing an absent
// string leaves the key out. Not synchronised: it is completed on one thread and then shared,
// unchanged.

#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/Number.h"
#include "platform/SharedString.h"

namespace tessel {

class Payload {
 public:
  using Value = std::variant<SharedString, Number>;
  // Keys are literals: the views given to set() must outlive the payload.
  using Entry = std::pair<std::string_view, Value>;

  void set(std::string_view key, SharedString value);
  void set(std::string_view key, Number value);
  // The value under `key`; null where there is none.
  const Value* find(std::string_view key) const;
  const std::vector<Entry>& entries() const { return entries_; }

 private:
  void store(std::string_view key, Value value);

  std::vector<Entry> entries_;
};

// The payload as one JSON object, keys in payload order, UTF-8. Bytes of a string that are not
// valid UTF-8 become U+FFFD, one for each maximal invalid part.
std::string payloadJson(const Payload& payload);

// Appends `text` as a JSON string literal, invalid UTF-8 replaced as above.
void appendJsonString(std::string& out, std::string_view text);

// `text` with invalid UTF-8 replaced as above.
std::string replaceInvalidUtf8(std::string_view text);

// True where `text` is well-formed UTF-8.
bool isValidUtf8(std::string_view text);

}  // namespace tessel
