// LossTokenizer: notices the entries in which the journal daemon says that it dropped others.
//
// It stands between the readers and the tokenizer of the store's user. It keeps the fields of such
// an entry under tokens of its own and takes them away before the user sees the entry. So the store
// counts what was dropped, and its users need not know how the daemon says it.
//
// Threads: one at a time.

#pragma once

#include <map>
#include <span>
#include <string>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/Losses.h"

namespace tessel {

class LossTokenizer final : public FieldTokenizer {
 public:
  // Anyone may write such entries, so both are bounded. Further units, and longer names (systemd
  // allows 255 bytes), are counted together under the empty name.
  static constexpr size_t kMaxUnits = 4096;
  static constexpr size_t kMaxUnitLength = 256;

  // `user` must outlive this.
  explicit LossTokenizer(FieldTokenizer& user) : user_(user) {}

  std::vector<EntryMark> marks() const override;
  bool wants(std::string_view fieldName) const override;
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  uint32_t generation() const override { return user_.generation(); }

  // The tokens of an entry without our own; valid until the next call. If the entry tells of a
  // loss, counts it. Call it once for each entry.
  std::span<const FieldToken> takeOwn(std::span<const FieldToken> tokens);
  // Adds what was counted. If the list has no room for all units, those that lost most come first.
  void addDropped(Losses& losses) const;

 private:
  struct DroppedEntries {
    std::string unit;  // empty: the daemon named none, or one too many
    uint64_t count = 0;
  };

  FieldToken unitToken(std::string_view name);
  void count(std::span<const FieldToken> own);

  FieldTokenizer& user_;
  bool met_ = false;  // whether the daemon's message was ever shown
  std::map<std::string, FieldToken, std::less<>> unitTokens_;
  std::vector<DroppedEntries> units_ = std::vector<DroppedEntries>(1);  // the first has no name
  std::vector<FieldToken> theirs_;
};

}  // namespace tessel
