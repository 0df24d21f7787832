// LossTokenizer: stands before the tokenizer of a store's user and keeps for the store the fields
// of the entries in which the journal daemon says that it dropped others.
//
// Threads: one at a time.

#pragma once

#include <span>
#include <string>
#include <vector>

#include "linux/trace/EntryStream.h"
#include "linux/trace/StoreReport.h"

namespace tessel {

class LossTokenizer final : public FieldTokenizer {
 public:
  // Counts and units that are kept apart; further ones are counted under no unit.
  static constexpr size_t kMaxUnits = 4096;

  // `user` must outlive this.
  explicit LossTokenizer(FieldTokenizer& user) : user_(user) {}

  bool wants(std::string_view fieldName) const override;
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  uint32_t generation() const override { return user_.generation(); }
  void beginEntry() override { user_.beginEntry(); }

  // The user's tokens among those of an entry; valid until the next call. Where the entry tells of
  // a loss, that is counted.
  std::span<const FieldToken> takeOwn(std::span<const FieldToken> tokens);
  const std::vector<DroppedEntries>& dropped() const { return dropped_; }

 private:
  FieldToken valueToken(std::string_view value, std::vector<std::string>& values, FieldToken first);
  void count(std::span<const FieldToken> own);
  DroppedEntries& unitNamed(const std::string& unit);

  FieldTokenizer& user_;
  bool met_ = false;  // an entry may tell of a loss
  std::vector<std::string> counts_;
  std::vector<std::string> units_;
  std::vector<DroppedEntries> dropped_;
  std::vector<FieldToken> theirs_;
};

}  // namespace tessel
