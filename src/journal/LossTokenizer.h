// LossTokenizer: stands before the tokenizer of a store's user and keeps for the store the fields
// of the entries in which the journal daemon says that it dropped others.
//
// Threads: one at a time.

#pragma once

#include <map>
#include <span>
#include <string>
#include <vector>

#include "journal/EntryStream.h"
#include "journal/StoreReport.h"

namespace tessel {

class LossTokenizer final : public FieldTokenizer {
 public:
  // Units that are kept apart, and the longest name of one; what others lost is counted under none.
  static constexpr size_t kMaxUnits = 4096;
  static constexpr size_t kMaxUnitLength = 256;

  // `user` must outlive this.
  explicit LossTokenizer(FieldTokenizer& user) : user_(user) {}

  std::vector<EntryMark> marks() const override;
  bool wants(std::string_view fieldName) const override;
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  uint32_t generation() const override { return user_.generation(); }

  // The user's tokens among those of an entry; valid until the next call. Where the entry tells of
  // a loss, that is counted.
  std::span<const FieldToken> takeOwn(std::span<const FieldToken> tokens);
  // What was counted, of no unit first, then in order of first sight.
  std::vector<DroppedEntries> dropped() const;

 private:
  FieldToken unitToken(std::string_view name);
  void count(std::span<const FieldToken> own);

  FieldTokenizer& user_;
  bool met_ = false;  // an entry may tell of a loss
  std::map<std::string, FieldToken, std::less<>> unitTokens_;
  std::vector<DroppedEntries> units_ = std::vector<DroppedEntries>(1);  // first what is of none
  std::vector<FieldToken> theirs_;
};

}  // namespace tessel
