// Building and asking of a StringSet.

#include "whitelist/StringSet.h"

namespace tessel {

StringSet::StringSet(std::initializer_list<List> lists) {
  for (const List& list : lists) {
    for (const std::string_view text : list) add(text);
  }
}

void StringSet::add(std::string_view text) {
  index_.findOrAdd(
      static_cast<uint32_t>(hashText(text)),
      [&](uint32_t number) { return texts_[number] == text; },
      [&] {
        texts_.push_back(text);
        return static_cast<uint32_t>(texts_.size() - 1);
      });
}

bool StringSet::contains(StringRef value) const {
  if (!value.present()) return false;
  const auto isValue = [&](uint32_t number) { return texts_[number] == value.text(); };
  return index_.find(static_cast<uint32_t>(value.hash()), isValue) != FlatIndex::kNone;
}

}  // namespace tessel
