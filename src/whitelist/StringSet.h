// StringSet: an immutable set of constant texts, asked with strings that carry their hash.
//
// It keeps views of the texts, which must outlive it. Asking hashes and copies nothing, and looks
// at a text only where the hashes agree. Any thread may ask.

#pragma once

#include <initializer_list>
#include <span>
#include <string_view>
#include <vector>

#include "platform/SharedString.h"

namespace tessel {

class StringSet {
 public:
  using List = std::span<const std::string_view>;

  // The union of `lists`; a text that occurs more than once is one element.
  StringSet(std::initializer_list<List> lists);

  // Exact, case-sensitive membership; an absent string is a member of no set.
  bool contains(StringRef value) const;
  size_t size() const { return size_; }

 private:
  struct Slot {
    uint64_t hash = 0;
    std::string_view text;  // a null view marks a free slot
  };
  void add(std::string_view text);

  // Open addressing; a power of two, with at least one slot free.
  std::vector<Slot> slots_;
  size_t size_ = 0;
};

}  // namespace tessel
