// LossTokenizer: counts the entries that the journal daemon dropped, from the daemon's own messages
// about them.
//
// A service that logs too fast exceeds the daemon's rate limit. The daemon then drops entries and
// writes one entry that says how many: a loss message. LossTokenizer stands between the readers and
// the tokenizer of the store's user. It gives the fields of a loss message tokens of its own, and
// removes these before the user sees the entry. So users of the store need not know how the daemon
// reports losses. Anyone can send the text of such a message; only the daemon can send it with its
// own _TRANSPORT, so others are not counted.
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
  // Anyone may start services, so the number of units and the length of their names are
  // bounded. Losses of further units, and of units with longer names (systemd allows 255 bytes),
  // count together under the empty name.
  static constexpr size_t kMaxUnits = 4096;
  static constexpr size_t kMaxUnitLength = 256;

  // `user` must outlive this.
  explicit LossTokenizer(FieldTokenizer& user) : user_(user) {}

  std::vector<std::string_view> marks() const override;
  bool wants(std::string_view fieldName) const override;
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  const uint32_t& generation() const override { return user_.generation(); }

  // Returns the tokens of an entry without our own; valid until the next call. If the entry is a
  // loss message, counts the loss, so call this once for each entry.
  std::span<const FieldToken> takeOwn(std::span<const FieldToken> tokens);
  // Adds the losses that were counted. If the list has no room for all units, those with the
  // greatest losses come first.
  void addDropped(Losses& losses) const;

 private:
  struct DroppedEntries {
    std::string unit;  // empty: no name, a name that is too long, or units beyond kMaxUnits
    uint64_t count = 0;
  };

  FieldToken unitToken(std::string_view name);
  void count(std::span<const FieldToken> own);

  FieldTokenizer& user_;
  bool met_ = false;  // whether any token of ours was given out yet
  std::map<std::string, FieldToken, std::less<>> unitTokens_;
  std::vector<DroppedEntries> units_ = std::vector<DroppedEntries>(1);  // the first has no name
  std::vector<FieldToken> theirs_;
};

}  // namespace tessel
