// Numbers and payloads, and their JSON.

#include "platform/Payload.h"

namespace tessel {

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

// Keys are searched one after the other: a payload has a few dozen at most, and a table beside the
// list that keeps their order would cost more than it saves.
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
