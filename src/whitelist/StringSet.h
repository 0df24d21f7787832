// StringSet: an immutable set of constant texts, asked with strings that carry their hash.
//
// It keeps views of the texts, which must outlive it. Asking hashes and copies nothing, and looks
// at a text only where the hashes agree. Any thread may ask.

#pragma once

#include <cstdint>
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
  void add(std::string_view text);
  size_t slotOf(std::string_view text, uint64_t hash) const;

  // Open addressing; a power of two, at most half of it taken. Most values that are asked about are
  // members of no set: what tells that is kept together, apart from the texts.
  std::vector<uint32_t> marks_;  // of the hash; 0: the slot is free
  std::vector<std::string_view> texts_;
  size_t size_ = 0;
};

}  // namespace tessel
