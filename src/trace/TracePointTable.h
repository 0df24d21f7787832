// TracePointTable: parses and interns each distinct FIELD=value of the store once.
//
// Its answer is a token: token = kind << 24 | index into the table. Equal values of a string, a
// process or a boot have equal tokens, and equal ids of intervals have equal identities, so whoever
// pairs or counts compares integers.
//
// A day may hold more distinct values than fit into memory. A table that is full() is therefore
// emptied, which starts a new generation of tokens and a new pool of strings. Its one user does
// that between two entries, when nobody but itself holds a token, and exchanges the tokens that it
// holds. Objects that were delivered hold no tokens; they keep the old pool of strings alive. The
// alternative, to throw out single values that were not used for long, was discarded: it would
// need a count of users for every value, and a reader would have to ask about every token.
//
// Threads: one at a time. The strings may be read from any thread by whoever keeps the pool.

#pragma once

#include <memory>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/FlatIndex.h"
#include "platform/Values.h"
#include "trace/TracePointFields.h"

namespace tessel {

// 512 Ki values of 16 bytes are 8 MiB, and 6 MiB hold the texts of about as many: the strings of an
// ordinary day fit several times over. While a generation is replaced, the old one and at most half
// of a new one are in memory together, so the whole stays near 20 MiB.
struct TracePointTableLimits {
  size_t fields = size_t{512} * 1024;          // distinct values; at most 15 million
  size_t textBytes = size_t{6} * 1024 * 1024;  // of interned text, its bookkeeping included
};

class TracePointTable final : public FieldTokenizer {
 public:
  explicit TracePointTable(TracePointTableLimits limits = {});

  std::vector<EntryMark> marks() const override;
  bool wants(std::string_view fieldName) const override;
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  uint32_t generation() const override { return generation_; }

  FieldToken bootToken(const Id128& boot);

  // The functions from here on answer the value of a token of this generation. A token is only good
  // for those that suit its kind; kNoToken is good for all, and its value is absent.
  static FieldKind kind(FieldToken token) { return FieldKind(token >> kIndexBits); }
  // Equal for equal values of one kind; 0 for an absent value.
  uint64_t identity(FieldToken token) const { return at(token).identity(); }
  StringRef text(FieldToken token) const { return StringRef(at(token).record); }
  std::optional<Number> number(FieldToken token) const;
  float real(FieldToken token) const { return at(token).real; }
  PointKind pointKind(FieldToken token) const;
  // Of the telemetry flag; of a scope, whether it is "system".
  bool flag(FieldToken token) const { return at(token).whole != 0; }
  MalformedReason malformedReason(FieldToken token) const;
  // Whether the bad field is one that every trace point has.
  bool malformedIsRequired(FieldToken token) const {
    return (at(token).whole & kMalformedRequired) != 0;
  }
  // Key and value. REQUIRES: the token is not kNoToken.
  const std::pair<StringRef, StringRef>& attribute(FieldToken token) const {
    return contents_.attributes[at(token).whole];
  }
  // Keeps every string of this generation alive.
  std::shared_ptr<const StringPool> strings() const { return contents_.strings; }

  // Whether the table is over its limits, and a new generation is due before the next entry.
  bool full() const { return holds(1); }
  class Renewal;
  // Empties the table. REQUIRES: no token of an entry is in use. Every token is void after the
  // call; one that is to be kept is exchanged through the answer.
  Renewal startGeneration();

 private:
  enum class Form : uint8_t { none, text, whole, unsignedWhole, fraction, real, forwarded };
  struct Field {
    union {
      const StringRecord* record = nullptr;
      uint64_t whole;  // of a signed number: its two's complement; forwarded: the new token
      double fraction;
      float real;
    };
    FieldKind kind = FieldKind::malformed;
    Form form = Form::none;

    // Two equal texts have one record, so its address stands for the text.
    uint64_t identity() const {
      return form == Form::text ? reinterpret_cast<uintptr_t>(record) : whole;
    }
  };
  struct Contents {
    std::shared_ptr<StringPool> strings = std::make_shared<StringPool>();
    std::vector<Field> fields;
    std::vector<std::pair<StringRef, StringRef>> attributes;
    FlatIndex index;  // of the tokens of fields that are found again by value
  };

  // A malformed value is its reason, with this bit where the bad field is a required one.
  static constexpr uint64_t kMalformedRequired = 0x100;
  static_assert(kMalformedReasons <= kMalformedRequired);
  // 24 bits number 16 million values, 32 times the limit. That leaves 8 bits for the kind, of which
  // the highest is 0: the tokens with that bit belong to the store itself.
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
  // Whether the table holds more than its limits divided by `share`.
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

// A generation that was just started, together with the values of the one before. REQUIRES: the
// table outlives it, and no entry is read while it lives.
class TracePointTable::Renewal {
 public:
  // The token of the new generation for one of the old.
  FieldToken renewed(FieldToken old);
  // Whether more may be kept. What is kept fills at most half of the table, or the next generation
  // would be due at once.
  bool hasRoom() const { return !table_.holds(2); }

 private:
  friend class TracePointTable;
  Renewal(TracePointTable& table, Contents old) : table_(table), old_(std::move(old)) {}
  FieldToken addAgain(const Field& old);

  TracePointTable& table_;
  Contents old_;
};

}  // namespace tessel
