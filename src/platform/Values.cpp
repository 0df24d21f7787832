// Shared strings, numbers and payloads.

#include "platform/Values.h"

#include <cstring>
#include <limits>
#include <new>
#include <stdexcept>

namespace tessel {

// Records, the seeded hash of a text and the interning of StringPool.

namespace {

uint64_t load(const char* at, size_t count) {
  uint64_t word = 0;
  std::memcpy(&word, at, count);
  return word;
}

}  // namespace

// Each step multiplies two words of the text. A writer who could make one factor zero would erase
// all the text before it, because the product is then zero. So both factors are mixed with values
// that depend on a seed.
uint64_t hashText(std::string_view text) {
  constexpr uint64_t kOdd = 0x9e3779b97f4a7c15u;
  const auto [first, second] = hashSeeds();
  uint64_t state = first;
  const char* at = text.data();
  size_t left = text.size();
  for (; left > 16; at += 16, left -= 16) {
    state = mixWords(load(at, 8) ^ state, load(at + 8, 8) ^ second);
  }
  const size_t low = left < 8 ? left : 8;
  state = mixWords(load(at, low) ^ state, load(at + low, left - low) ^ second);
  return mixWords(state ^ text.size(), kOdd);
}

SharedString::SharedString(std::string_view text, uint64_t hash) {
  if (text.size() > std::numeric_limits<uint32_t>::max()) throw std::length_error("SharedString");
  void* storage = ::operator new(sizeof(StringRecord) + text.size());
  auto* record = new (storage) StringRecord(hash, static_cast<uint32_t>(text.size()));
  if (!text.empty())
    std::memcpy(static_cast<char*>(storage) + sizeof(StringRecord), text.data(), text.size());
  record_ = record;
}

void SharedString::release() {
  if (record_ == nullptr) return;
  if (record_->references_.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
  record_->~StringRecord();
  ::operator delete(const_cast<StringRecord*>(record_));
}

StringPool::Noted StringPool::internNoted(std::string_view text) {
  const uint64_t hash = hashText(text);
  const uint32_t number = index_.findOrAdd(
      static_cast<uint32_t>(hash),
      [&](uint32_t other) { return strings_[other].string.text() == text; },
      [&] {
        strings_.push_back({SharedString(text, hash), 0});
        textBytes_ += sizeof(StringRecord) + text.size();
        return static_cast<uint32_t>(strings_.size() - 1);
      });
  return {strings_[number].string, strings_[number].note};
}

bool booleanValue(const Number& number) {
  return std::visit([](auto value) { return value != decltype(value){}; }, number);
}

std::string numberText(const Number& number) {
  std::string text;
  JsonWriter(text).value(number);
  return text;
}

void Payload::set(std::string_view key, SharedString value) {
  if (value) store(key, std::move(value));
}

void Payload::set(std::string_view key, Number value) { store(key, value); }

// Keys are compared one after the other. A payload has a few dozen keys at most, so an index beside
// the list would cost more than it saves.
void Payload::store(std::string_view key, Value value) {
  for (Entry& entry : entries_) {
    if (entry.first == key) {
      entry.second = std::move(value);
      return;
    }
  }
  entries_.emplace_back(key, std::move(value));
}

const Payload::Value* Payload::find(std::string_view key) const {
  for (const Entry& entry : entries_) {
    if (entry.first == key) return &entry.second;
  }
  return nullptr;
}

std::string payloadJson(const Payload& payload, JsonStyle style) {
  std::string out;
  JsonWriter json(out, style);
  json.object([&] {
    for (const auto& [key, value] : payload.entries()) json.member(key, value);
  });
  return out;
}

}  // namespace tessel
