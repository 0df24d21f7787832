// Building and probing of a StringSet.

#include "whitelist/StringSet.h"

#include <bit>

namespace tessel {

StringSet::StringSet(std::initializer_list<List> lists) {
  size_t entries = 0;
  for (const List& list : lists) entries += list.size();
  slots_.resize(std::bit_ceil(entries + entries / 2 + 1));
  for (const List& list : lists) {
    for (const std::string_view text : list) add(text);
  }
}

void StringSet::add(std::string_view text) {
  const uint64_t hash = hashText(text);
  const size_t mask = slots_.size() - 1;
  size_t at = hash & mask;
  for (; slots_[at].text.data() != nullptr; at = (at + 1) & mask) {
    if (slots_[at].text == text) return;
  }
  slots_[at] = {hash, text};
  ++size_;
}

bool StringSet::contains(StringRef value) const {
  if (!value.present()) return false;
  const uint64_t hash = value.hash();
  const size_t mask = slots_.size() - 1;
  for (size_t at = hash & mask; slots_[at].text.data() != nullptr; at = (at + 1) & mask) {
    if (slots_[at].hash == hash && slots_[at].text == value.text()) return true;
  }
  return false;
}

}  // namespace tessel
