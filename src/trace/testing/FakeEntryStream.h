// Entries made in memory, for tests only.

#pragma once

#include <string>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel::testing {

struct FakeEntry {
  std::vector<std::string> fields;  // FIELD=value
  EntryHeader header;
};

// Shows every field of every entry to the tokenizer, as an export file does.
class FakeEntryStream final : public EntryStream {
 public:
  explicit FakeEntryStream(FieldTokenizer& tokenizer, std::vector<FakeEntry> all = {})
      : entries(std::move(all)), tokenizer_(tokenizer) {}

  bool next() override;
  const EntryHeader& header() const override { return entries[at_ - 1].header; }
  std::span<const FieldToken> tokens() override;

  std::vector<FakeEntry> entries;  // may grow while the stream is read

 private:
  FieldTokenizer& tokenizer_;
  size_t at_ = 0;
  std::vector<FieldToken> tokens_;
};

// The fields of one entry, separated by '|', with what every trace point needs put in front:
// "begin|NAME=Open|ATTRIBUTE=a=b" is a begin of com.vantor.Calendar/View, and "|CATEGORY=a" makes
// it one of com.vantor.Calendar/a. A name without a leading underscore gets the prefix of trace
// points.
FakeEntry tracePoint(std::string_view text, uint64_t monotonic = 0, uint8_t boot = 1);

}  // namespace tessel::testing
