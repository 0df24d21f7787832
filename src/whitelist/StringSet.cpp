// Building and probing of a StringSet.

#include "whitelist/StringSet.h"

#include <bit>

namespace tessel {

namespace {
// The half of a hash that does not choose the slot, never 0.
uint32_t markOf(uint64_t hash) { return static_cast<uint32_t>(hash >> 32) | 1; }
}  // namespace

StringSet::StringSet(std::initializer_list<List> lists) {
  size_t entries = 0;
  for (const List& list : lists) entries += list.size();
  marks_.resize(std::bit_ceil(2 * entries + 1));
  texts_.resize(marks_.size());
  for (const List& list : lists) {
    for (const std::string_view text : list) add(text);
  }
}

void StringSet::add(std::string_view text) {
  const uint64_t hash = hashText(text);
  const size_t at = slotOf(text, hash);
  size_ += marks_[at] == 0;
  marks_[at] = markOf(hash);
  texts_[at] = text;
}

// The slot of the text, or the free one where it would stand.
size_t StringSet::slotOf(std::string_view text, uint64_t hash) const {
  const size_t mask = marks_.size() - 1;
  const uint32_t mark = markOf(hash);
  size_t at = hash & mask;
  while (marks_[at] != 0 && (marks_[at] != mark || texts_[at] != text)) at = (at + 1) & mask;
  return at;
}

bool StringSet::contains(StringRef value) const {
  return value.present() && marks_[slotOf(value.text(), value.hash())] != 0;
}

}  // namespace tessel
