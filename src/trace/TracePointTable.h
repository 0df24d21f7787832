// TracePointTable: parses and interns each distinct FIELD=value of the store once.
//
// It gives out tokens: token = kind << 24 | index into the table. Equal strings, processes and
// boots have equal tokens within one kind, and equal interval ids have equal identities. So pairing
// compares integers.
//
// A day may hold more distinct values than fit into memory. So IntervalAssembler, the only user,
// empties a full table between two entries. That starts a new generation of tokens and a new pool
// of strings. At that moment only the open intervals hold tokens, and the user exchanges them for
// new ones. Delivered objects hold no tokens; they keep the old pool of strings alive. We discarded
// the alternative of removing single values that were not used for long. It would need a count of
// users for every value, and readers would have to check every token.
//
// Threads: one at a time. A thread that keeps the pool may read its strings at any time.

#pragma once

#include <array>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/FlatIndex.h"
#include "platform/Values.h"
#include "trace/TracePointFields.h"

namespace tessel {

// 512 Ki values of 16 bytes take 8 MiB, and their texts may take 6 MiB. The strings of an ordinary
// day fit several times over. While a new generation replaces the old one, the old one and at most
// half of the new one are in memory. So both together stay near 20 MiB.
struct TracePointTableLimits {
  size_t fields = size_t{512} * 1024;          // distinct values; at most 15 million
  size_t textBytes = size_t{6} * 1024 * 1024;  // of interned text, its bookkeeping included
};

// The tokens of one trace point, by kind.
using PointTokens = std::array<FieldToken, kPointSlots>;

inline FieldToken tokenOf(const PointTokens& tokens, FieldKind kind) {
  return tokens[static_cast<size_t>(kind)];
}

class TracePointTable final : public FieldTokenizer {
 public:
  explicit TracePointTable(TracePointTableLimits limits = {});

  std::vector<std::string_view> marks() const override;
  bool wants(std::string_view fieldName) const override;
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  const uint32_t& generation() const override { return generation_; }

  FieldToken bootToken(const Id128& boot);

  // These functions answer the value of a token. REQUIRES: the token is of this generation, and the
  // function suits its kind. kNoToken suits all but attribute(); its value is absent.
  static FieldKind kind(FieldToken token) { return FieldKind(token >> kIndexBits); }
  // Equal for equal values of one kind; 0 for an absent value.
  uint64_t identity(FieldToken token) const { return at(token).identity(); }
  StringRef text(FieldToken token) const { return StringRef(at(token).record); }
  std::optional<Number> number(FieldToken token) const;
  // The number if it can be that of a user or process.
  std::optional<uint32_t> user(FieldToken token) const {
    const Field& field = at(token);
    if (field.form != Form::whole || field.whole > UINT32_MAX) return std::nullopt;
    return static_cast<uint32_t>(field.whole);
  }
  // The number if it is one that counts something; else 0.
  uint64_t count(FieldToken token) const {
    const Field& field = at(token);
    const bool counts = field.form == Form::unsignedWhole ||
                        (field.form == Form::whole && field.whole <= uint64_t{INT64_MAX});
    return counts ? field.whole : 0;
  }
  float real(FieldToken token) const { return at(token).real; }
  PointKind pointKind(FieldToken token) const;
  // For the telemetry field: whether it is on. For a scope: whether it is "system".
  bool flag(FieldToken token) const { return at(token).whole != 0; }
  MalformedReason malformedReason(FieldToken token) const;
  // A mark that the user of the table may set on a value. It lasts as long as the token, and an
  // absent value has it.
  bool noted(FieldToken token) const { return at(token).noted; }
  void note(FieldToken token) { contents_.fields[indexOf(token)].noted = true; }
  // A number that the user of the table may set on a value. It lasts as long as the token. 0 if
  // none was set.
  uint32_t numberOn(FieldToken token) const { return at(token).userNumber; }
  void setNumberOn(FieldToken token, uint32_t number) {
    contents_.fields[indexOf(token)].userNumber = number;
  }
  // Whether the value of `token` comes after that of `other`: texts in the order of their bytes,
  // numbers in that of their values, words in that of their table, and a text after a number.
  // REQUIRES: both are of one kind, which is neither an attribute nor malformed.
  bool isGreater(FieldToken token, FieldToken other) const;
  // Whether the bad field is a required one.
  bool malformedIsRequired(FieldToken token) const {
    return (at(token).whole & kMalformedRequired) != 0;
  }
  // The key and the value. REQUIRES: the token is not kNoToken.
  const std::pair<StringRef, StringRef>& attribute(FieldToken token) const {
    return contents_.attributes[at(token).whole];
  }
  // Bytes that the values of this generation take, without the room for further ones.
  size_t bytes() const {
    return (contents_.fields.size() + contents_.attributes.size()) * sizeof(Field) +
           contents_.strings->textBytes();
  }
  // Keeps every string of this generation alive.
  std::shared_ptr<const StringPool> strings() const { return contents_.strings; }

  // Whether the table is over its limits. If so, a new generation is due before the next entry.
  bool full() const { return holds(1); }
  class Renewal;
  // Empties the table, so that every token becomes invalid. The caller exchanges the tokens that it
  // keeps through the answer. REQUIRES: the tokens of the current entry are no longer in use.
  Renewal startGeneration();

 private:
  enum class Form : uint8_t { none, text, whole, unsignedWhole, fraction, real, forwarded };
  struct Field {
    union {
      const StringRecord* record = nullptr;
      uint64_t whole;  // a signed number in two's complement; if forwarded, the new token
      double fraction;
      float real;
    };
    FieldKind kind = FieldKind::malformed;
    Form form = Form::none;
    bool noted = false;
    uint32_t userNumber = 0;

    // The pool keeps one record for equal texts, so the address of the record identifies the text.
    uint64_t identity() const {
      return form == Form::text ? reinterpret_cast<uintptr_t>(record) : whole;
    }
  };
  struct Contents {
    std::shared_ptr<StringPool> strings = std::make_shared<StringPool>();
    std::vector<Field> fields;
    std::vector<std::pair<StringRef, StringRef>> attributes;
    FlatIndex index;  // finds a token by the value of its field
  };

  // The value of a malformed token is the reason. This bit is added if the bad field is required.
  static constexpr uint64_t kMalformedRequired = 0x100;
  static_assert(kMalformedReasons <= kMalformedRequired);
  // 24 bits can number 16 million values, which is 32 times the default limit. The other 8 bits
  // hold the kind. Its highest bit is always 0, because tokens with that bit set belong to the
  // store.
  static constexpr int kIndexBits = 24;
  static_assert(FieldToken(FieldKind::boot) < kFirstReservedToken >> kIndexBits);

  static size_t indexOf(FieldToken token) { return token & ((1u << kIndexBits) - 1); }
  const Field& at(FieldToken token) const { return contents_.fields[indexOf(token)]; }
  static Field wholeField(FieldKind kind, uint64_t value);
  static Contents emptyContents(const TracePointTableLimits& limits);
  FieldToken malformedToken(FieldKind kind, MalformedReason reason);
  FieldToken parse(const JournalField& field, std::string_view value);
  FieldToken parseNumber(const JournalField& field, std::string_view value);
  FieldToken parseIdentifier(FieldKind kind, std::string_view value);
  FieldToken addAttribute(std::string_view key, std::string_view value);
  FieldToken textToken(FieldKind kind, std::string_view value);
  FieldToken add(const Field& field);
  FieldToken addOnce(const Field& field);
  // Whether the table holds more than 1/`share` of one of its limits.
  bool holds(size_t share) const {
    return contents_.fields.size() + contents_.attributes.size() > limits_.fields / share ||
           contents_.strings->memoryUsed() > limits_.textBytes / share;
  }

  const TracePointTableLimits limits_;
  uint32_t generation_ = 0;
  Contents contents_;
  Id128 lastBoot_{};
  FieldToken lastBootToken_ = kNoToken;
};

// Carries tokens over from the old generation to the one that was just started. REQUIRES: the table
// outlives the renewal, and nobody reads an entry while the renewal lives.
class TracePointTable::Renewal {
 public:
  // The new token for the value of an old token.
  FieldToken renewed(FieldToken old);
  // Whether there is room to keep more. We fill only half of the table with kept values, because a
  // table that is nearly full would need the next generation at once.
  bool hasRoom() const { return !table_.holds(2); }

 private:
  friend class TracePointTable;
  Renewal(TracePointTable& table, Contents old) : table_(table), old_(std::move(old)) {}
  FieldToken addAgain(const Field& old);

  TracePointTable& table_;
  Contents old_;
};

}  // namespace tessel
