// StringSet: an immutable set of constant texts, asked with strings that carry their hash.
//
// It keeps views of the texts, which must outlive it. Asking hashes and copies nothing, and looks
// at a text only where the hashes agree. Any thread may ask.

#pragma once

#include <cstddef>
#include <initializer_list>
#include <span>
#include <string_view>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/SharedString.h"

namespace tessel {

class StringSet {
 public:
  using List = std::span<const std::string_view>;

  // The union of `lists`; a text that occurs more than once is one element.
  StringSet(std::initializer_list<List> lists);

  // Exact, case-sensitive membership; an absent string is a member of no set.
  bool contains(StringRef value) const;
  size_t size() const { return texts_.size(); }

 private:
  void add(std::string_view text);

  std::vector<std::string_view> texts_;
  FlatIndex index_;  // of texts_
};

}  // namespace tessel
