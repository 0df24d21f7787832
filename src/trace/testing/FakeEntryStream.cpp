#include "trace/testing/FakeEntryStream.h"

namespace tessel::testing {

bool FakeEntryStream::next() {
  if (at_ == entries.size()) return false;
  ++at_;
  return true;
}

std::span<const FieldToken> FakeEntryStream::tokens() {
  tokens_.clear();
  for (const std::string& field : entries[at_ - 1].fields) {
    const std::string_view name = std::string_view(field).substr(0, field.find('='));
    const std::string_view value = std::string_view(field).substr(name.size() + 1);
    if (!tokenizer_.wants(name)) continue;
    const FieldToken token =
        tokenizer_.tokenFor(name, value.substr(0, kMaxFieldValueLength + 1), value.size());
    if (token != kNoToken) tokens_.push_back(token);
  }
  return tokens_;
}

FakeEntry tracePoint(std::string_view text, uint64_t monotonic, uint8_t boot) {
  FakeEntry entry;
  entry.header.bootId[0] = boot;
  entry.header.monotonic = monotonic;
  const size_t kindLength = text.find('|');
  entry.fields = {"MESSAGE=tessel", "TESSEL_KIND=" + std::string(text.substr(0, kindLength))};
  for (const std::string_view field : {"SUBSYSTEM=com.vantor.Calendar", "CATEGORY=View"}) {
    const std::string name = "|" + std::string(field.substr(0, field.find('=') + 1));
    if (text.find(name) == std::string_view::npos)
      entry.fields.push_back("TESSEL_" + std::string(field));
  }
  text.remove_prefix(kindLength == std::string_view::npos ? text.size() : kindLength + 1);
  while (!text.empty()) {
    const std::string_view field = text.substr(0, text.find('|'));
    text.remove_prefix(std::min(text.size(), field.size() + 1));
    entry.fields.push_back((field.starts_with('_') ? "" : "TESSEL_") + std::string(field));
  }
  return entry;
}

}  // namespace tessel::testing
