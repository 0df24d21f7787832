// EntryStream: journal entries, one after another, with their fields as small integers.
//
// A journal stores each distinct FIELD=value once, and entries refer to it. We use this: a reader
// shows a text to a FieldTokenizer, which parses it and returns a token. When the reader meets the
// same text again, it usually still knows the token and only copies an integer. So an entry is a
// header and a list of tokens. Fields of no interest have the token kNoToken and are left out of
// the list.
//
// Threads: one at a time, except for StopFlag.

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
// LossTokenizer uses tokens from here on; the tokenizer of a store's user stays below.
inline constexpr FieldToken kFirstReservedToken = 0x80000000;

using Id128 = std::array<uint8_t, 16>;

// Two words are compared faster than sixteen bytes, and the merge compares ids for every entry.
inline bool sameId(const Id128& a, const Id128& b) {
  uint64_t left[2];
  uint64_t right[2];
  std::memcpy(left, a.data(), sizeof left);
  std::memcpy(right, b.data(), sizeof right);
  return left[0] == right[0] && left[1] == right[1];
}

// Bytes. The journal takes no longer names, so a text without '=' in its first 65 bytes is damaged.
inline constexpr size_t kMaxFieldNameLength = 64;
// Bytes. A tokenizer sees a value of at most this length whole, and only the beginning of a longer
// one.
inline constexpr size_t kMaxFieldValueLength = 4096;
// Name, '=', value, and one more byte, which shows that a longer value was cut.
inline constexpr size_t kMaxFieldHead = kMaxFieldNameLength + 1 + kMaxFieldValueLength + 1;

// Bytes. A reader looks at no more of each FIELD=value to find the entries that are needed.
inline constexpr size_t kMaxMark = 64;

// Turns distinct FIELD=value texts into tokens.
class FieldTokenizer {
 public:
  virtual ~FieldTokenizer() = default;
  // The user needs only entries that have a FIELD=value which begins with one of these texts;
  // empty: it needs every entry. A reader may deliver the other entries without tokens. A text is
  // at most kMaxMark bytes long.
  virtual std::vector<std::string_view> marks() const { return {}; }
  // Whether a field of this name can ever have a token. Asked before a value is decompressed.
  virtual bool wants(std::string_view fieldName) const = 0;
  // The token of one FIELD=value; kNoToken if the field is not wanted. `value` is the whole value,
  // or its first kMaxFieldValueLength + 1 bytes or more. `size` is the length of the whole value in
  // bytes if it is known; otherwise it is any number greater than value.size(). The same text may
  // be shown more than once.
  virtual FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) = 0;
  // Changes when the tokenizer forgets all its texts to stay within its memory. All tokens that it
  // returned before are then void. A reader compares it before it collects the tokens of an entry
  // and shows the texts again if it changed. It changes only between two entries: from the call of
  // EntryStream::tokens() until its user is done with the tokens, every token is good. A reader
  // keeps the reference, which is valid as long as the tokenizer, and looks at the number there.
  virtual const uint32_t& generation() const = 0;
};

// When an entry was written, and its place in the journal's order.
struct EntryHeader {
  Id128 sequenceId{};  // the sequence that `sequenceNumber` counts in; all zero: unknown
  uint64_t sequenceNumber = 0;
  Id128 bootId{};
  uint64_t monotonic = 0;    // microseconds since boot
  uint64_t realtime = 0;     // microseconds since 1970, UTC
  uint64_t contentHash = 0;  // exclusive or of the hashes of its data objects; 0: unknown
};

// Valid until the next call of next().
struct Entry {
  const EntryHeader& header;
  std::span<const FieldToken> tokens;
};

// Set from any thread. Readers look at it often enough to end within some 20 milliseconds.
using StopFlag = std::atomic<bool>;

class EntryStream {
 public:
  virtual ~EntryStream() = default;
  // Moves to the next entry. False at the end, or soon after the stop flag was set.
  virtual bool next() = 0;
  // All REQUIRE that the last next() returned true. header() costs nothing. tokens() collects the
  // tokens, so a caller that only counts or skips the entry does not call it. They are valid until
  // the next call of next(). A span is returned in registers; an Entry takes its way through
  // memory, so no stream returns one.
  virtual const EntryHeader& header() const = 0;
  virtual std::span<const FieldToken> tokens() = 0;
  Entry entry() { return {header(), tokens()}; }
};

// The cursor of an entry: a text that identifies the entry and that `journalctl --cursor=` accepts.
// "s=<sequence id>;i=<number>;b=<boot id>;m=<monotonic>;t=<realtime>;x=<content hash>", in
// hexadecimal.
std::string cursorOf(const EntryHeader& header);

// The header that a cursor names; nothing if a part is missing or is no hexadecimal number.
std::optional<EntryHeader> parseCursor(std::string_view cursor);

// Reads 32 hexadecimal digits, with or without the dashes of a UUID; nothing for other texts.
std::optional<Id128> parseId128(std::string_view text);
std::string textOf(const Id128& id);
// Sets `out` and returns true if the whole of `text` is a number in `base`, without a sign.
// Otherwise returns false; `out` may have changed then.
bool parseNumber(std::string_view text, int base, uint64_t& out);

}  // namespace tessel
