// EntryStream: the entries of a journal store, one after another, their fields as small integers.
//
// A store keeps each distinct FIELD=value once and an entry refers to it. So the reader shows each
// distinct value once to a FieldTokenizer, which parses and interns it and answers with a token;
// an entry then is a header and a list of tokens. Fields of no interest have token 0 and are left
// out of the list.
//
// Threads: one at a time, but for StopFlag.
//
// The cursor of an entry: its place in text form, as `journalctl --cursor=` takes it.

#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <cstring>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace tessel {

using FieldToken = uint32_t;
inline constexpr FieldToken kNoToken = 0;
// Tokens from here on belong to the store itself; a tokenizer stays below.
inline constexpr FieldToken kFirstReservedToken = 0x80000000;

using Id128 = std::array<uint8_t, 16>;

inline bool sameId(const Id128& a, const Id128& b) {
  uint64_t left[2];
  uint64_t right[2];
  std::memcpy(left, a.data(), sizeof left);
  std::memcpy(right, b.data(), sizeof right);
  return left[0] == right[0] && left[1] == right[1];
}

// Longest name of a field and longest value that a tokenizer is shown in full.
inline constexpr size_t kMaxFieldNameLength = 64;
inline constexpr size_t kMaxFieldValueLength = 4096;
inline constexpr size_t kMaxFieldHead = kMaxFieldNameLength + 1 + kMaxFieldValueLength + 1;

// A field that makes an entry worth showing. Companions are fields that make it so as well, and
// that nearly always stand in the same entries.
struct EntryMark {
  std::string_view field;
  std::string_view value = {};  // the one that counts; empty: any does
  std::vector<std::string_view> companions = {};
};

// Turns distinct FIELD=value texts into tokens.
class FieldTokenizer {
 public:
  virtual ~FieldTokenizer() = default;
  // What makes an entry worth showing; where there is nothing, every entry is. A reader that knows
  // which entries carry a mark may deliver the others without tokens.
  virtual std::vector<EntryMark> marks() const { return {}; }
  // Whether a field of this name can ever have a token; asked before a value is decompressed.
  virtual bool wants(std::string_view fieldName) const = 0;
  // The token of one FIELD=value; kNoToken for a field that is not wanted. `value` is the value's
  // beginning, at least kMaxFieldValueLength + 1 bytes where there are so many; `size` its whole
  // length in bytes, as far as known: where `value` is only the beginning, it may be any number
  // greater than value.size(). The same text may be shown more than once.
  virtual FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) = 0;
  // Changes when all tokens handed out so far become void, because the tokenizer was emptied to
  // stay within its memory. A reader compares it before it collects the tokens of an entry, and
  // where it changed drops all tokens that it remembers. It changes only between two entries: from
  // the call of EntryStream::entry() until its user is done with the tokens, every token is good.
  virtual uint32_t generation() const = 0;
};

// Where an entry stands in time and in the journal's own order.
struct EntryHeader {
  Id128 sequenceId{};  // which sequence `sequenceNumber` counts in; all zero: unknown
  uint64_t sequenceNumber = 0;
  Id128 bootId{};
  uint64_t monotonic = 0;    // microseconds since boot
  uint64_t realtime = 0;     // microseconds since 1970, UTC
  uint64_t contentHash = 0;  // exclusive or of the hashes of its data; 0: unknown
};

// Valid until the next call of next().
struct Entry {
  const EntryHeader& header;
  std::span<const FieldToken> tokens;
};

// Set from any thread; readers look at it often enough to end within a few milliseconds.
using StopFlag = std::atomic<bool>;

class EntryStream {
 public:
  virtual ~EntryStream() = default;
  // Moves to the next entry; false at the end, or soon after the stop flag was set.
  virtual bool next() = 0;
  // REQUIRES: the last next() answered true. Peeking at the header costs nothing; the tokens are
  // collected by entry().
  virtual const EntryHeader& header() const = 0;
  virtual Entry entry() = 0;
};

// "s=<sequence id>;i=<number>;b=<boot id>;m=<monotonic>;t=<realtime>;x=<content hash>", in
// hexadecimal.
std::string cursorOf(const EntryHeader& header);

// The header that a cursor names; nothing where a part is missing or no hexadecimal number.
std::optional<EntryHeader> parseCursor(std::string_view cursor);

// 32 hexadecimal digits, with or without the dashes of a UUID; nothing for any other text.
std::optional<Id128> parseId128(std::string_view text);
std::string textOf(const Id128& id);

}  // namespace tessel
