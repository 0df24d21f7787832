// The words of a journal, and what each may become.

#include "journal/testing/JournalBender.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "journal/JournalFormat.h"

namespace tessel::testing {

using namespace journal_format;

namespace {

uint64_t wordAt(const std::string& file, uint64_t at) {
  return load<uint64_t>(reinterpret_cast<const uint8_t*>(file.data()) + at);
}

}  // namespace

void put(std::string& file, uint64_t at, uint64_t value) {
  std::memcpy(file.data() + at, &value, sizeof value);
}

JournalBender::JournalBender(std::string file, bool compact)
    : file_(std::move(file)), compact_(compact) {
  for (uint64_t at = wordAt(file_, kHeaderSizeAt); at + 16 <= file_.size();) {
    objects_.push_back({static_cast<uint8_t>(file_[at]), at, wordAt(file_, at + kObjectSizeAt)});
    at = alignUp(at + objects_.back().size);
  }
}

std::pair<std::string, std::string> JournalBender::bent(std::mt19937_64& random) const {
  std::string file = file_;
  uint64_t at = random() % (kMinHeaderSize / 8 - 1) * 8 + 8;
  std::string name = "header + " + std::to_string(at);
  uint8_t type = 0;
  if (random() % 16 != 0) {
    const Object& object = objects_[random() % objects_.size()];
    type = object.type;
    const uint64_t within = random() % alignUp(object.size) & ~uint64_t{7};
    at = object.offset + within;
    name = "type " + std::to_string(type) + " at " + std::to_string(object.offset) + " + " +
           std::to_string(within);
  }
  // Two places of a compact list share a word.
  const bool half = compact_ && (type == kEntry || type == kEntryArray) && random() % 2 == 0;
  const uint64_t old = wordAt(file, at);
  const uint64_t value =
      half ? (old & UINT32_MAX) | other(old >> 32, random) << 32 : other(old, random);
  put(file, at, value);
  return {file, name + ": " + std::to_string(old) + " to " + std::to_string(value)};
}

uint64_t JournalBender::other(uint64_t old, std::mt19937_64& random) const {
  switch (random() % 6) {
    case 0:
      return old == 0 ? UINT64_MAX : 0;
    case 1:
      return old ^ uint64_t { 1 } << random() % (random() % 2 == 0 ? 16 : 64);
    case 2:
      return old + 8;
    case 3:
      return old + 1;
    default:
      return similar(old, random);
  }
}

// The offset or the size of another object, of the same type if `old` is an object's.
uint64_t JournalBender::similar(uint64_t old, std::mt19937_64& random) const {
  const auto known = std::ranges::find(objects_, old, &Object::offset);
  for (int tries = 0; tries < 50; ++tries) {
    const Object& object = objects_[random() % objects_.size()];
    if (known == objects_.end()) return random() % 2 == 0 ? object.size : object.offset;
    if (object.type == known->type && object.offset != old) return object.offset;
  }
  return old + 16;
}

std::vector<JournalLayout> everyLayout() {
  std::vector<JournalLayout> all;
  for (const bool compact : {false, true})
    for (const bool keyed : {false, true})
      for (const uint8_t compression : {uint8_t{0}, uint8_t{kXz}, uint8_t{kLz4}, uint8_t{kZstd}})
        for (const uint8_t state : {kArchived, kOnline})
          all.push_back({.compact = compact,
                         .keyed = keyed,
                         .compression = compression,
                         .compressFrom = 24,
                         .state = state});
  return all;
}

uint64_t damageRounds(uint64_t usual) {
  const char* wanted = std::getenv("TESSEL_DAMAGE_ROUNDS");
  return wanted != nullptr ? std::strtoull(wanted, nullptr, 10) : usual;
}

}  // namespace tessel::testing
