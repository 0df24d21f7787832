// Reads journals with libsystemd and journalctl, so that tests can compare our reader with them.
// For tests only.

#pragma once

#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel::testing {

// An entry with its fields as texts, sorted; fields beyond kMaxFieldHead are cut there.
struct PlainEntry {
  EntryHeader header;
  std::vector<std::string> fields;
};

bool operator==(const PlainEntry& a, const PlainEntry& b);
std::ostream& operator<<(std::ostream& out, const PlainEntry& entry);

// Wants every field and gives each distinct text its own token.
class RecordingTokenizer final : public FieldTokenizer {
 public:
  explicit RecordingTokenizer(std::vector<std::string_view> marks = {})
      : marks_(std::move(marks)) {}

  std::vector<std::string_view> marks() const override { return marks_; }
  bool wants(std::string_view) const override { return true; }
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  const uint32_t& generation() const override { return generation_; }
  // To be called between two entries.
  void beginNext() { generation_ += newGenerations; }

  bool newGenerations = false;  // whether all tokens become void with each entry

  const std::string& text(FieldToken token) const { return texts_.at(token - 1); }
  // How often any text was shown.
  size_t shown() const { return shown_; }

 private:
  const std::vector<std::string_view> marks_;
  std::map<std::string, FieldToken, std::less<>> tokens_;
  std::vector<std::string> texts_;
  size_t shown_ = 0;
  uint32_t generation_ = 0;
};

// All entries from the current place of a stream to its end.
std::vector<PlainEntry> readAll(EntryStream& stream, RecordingTokenizer& tokenizer);

// All entries of `files`, merged by libsystemd. Its entries have no content hash and no sequence.
std::vector<PlainEntry> readWithLibsystemd(const std::vector<std::string>& files);

// All entries of the directory or file `path` as `journalctl -o export` prints them.
std::vector<PlainEntry> readWithJournalctl(const std::string& path);

}  // namespace tessel::testing
