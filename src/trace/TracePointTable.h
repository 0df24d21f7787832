// TracePointTable: each distinct FIELD=value of the store, parsed and interned once.
//
// A token is a kind of field and an index into the table. Equal values of a string, a process or a
// boot have equal tokens, equal ids of intervals equal identities, so whoever pairs or counts
// compares integers. The table is bounded:
// over its limits it is emptied between two entries and starts a new generation, with a new string
// pool; delivered objects keep the old pool alive as long as they need it, and a TokenHolder takes
// along what it holds.
//
// Threads: one at a time. The strings may be read from any thread by whoever keeps the pool.

#pragma once

#include <memory>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/FlatIndex.h"
#include "platform/Payload.h"
#include "platform/SharedString.h"
#include "trace/TracePointFields.h"

namespace tessel {

class TracePointTable;

// Keeps tokens from one entry to the next.
class TokenHolder {
 public:
  virtual ~TokenHolder() = default;
  // The table starts a new generation: every token that is kept must be exchanged, through
  // table.renewed(), while table.hasRoomForRenewal().
  virtual void renewTokens(TracePointTable& table) = 0;
};

struct TracePointTableLimits {
  size_t fields = size_t{512} * 1024;          // distinct values; at most 16 million
  size_t textBytes = size_t{6} * 1024 * 1024;  // of interned text, its bookkeeping included
};

class TracePointTable final : public FieldTokenizer {
 public:
  explicit TracePointTable(TracePointTableLimits limits = {});

  // REQUIRES: `holder`, where not null, outlives the last call of beginEntry().
  void setHolder(TokenHolder* holder) { holder_ = holder; }

  std::vector<EntryMark> marks() const override;
  bool wants(std::string_view fieldName) const override;
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override;
  uint32_t generation() const override { return generation_; }
  void beginEntry() override;

  FieldToken bootToken(const Id128& boot);

  // The value of a token of this generation; what `kNoToken` stands for is absent.
  static FieldKind kind(FieldToken token) { return FieldKind(token >> kIndexBits); }
  // Equal for equal values of one kind; 0 for what is absent.
  uint64_t identity(FieldToken token) const { return at(token).identity(); }
  StringRef text(FieldToken token) const { return StringRef(at(token).record); }
  std::optional<Number> number(FieldToken token) const;
  // REQUIRES: the token is one of a duration or a frame rate.
  float real(FieldToken token) const { return at(token).real; }
  // REQUIRES: the token is one of a point kind; of a scope or the telemetry flag; of what is
  // malformed.
  PointKind pointKind(FieldToken token) const;
  bool flag(FieldToken token) const { return token != kNoToken && at(token).whole != 0; }
  MalformedReason malformedReason(FieldToken token) const;
  // Whether what is malformed is a field that every trace point has.
  bool malformedIsRequired(FieldToken token) const {
    return (at(token).whole & kMalformedRequired) != 0;
  }
  // REQUIRES: the token is one of an attribute.
  const std::pair<StringRef, StringRef>& attribute(FieldToken token) const {
    return contents_.attributes[at(token).whole];
  }
  // Keeps every string of this generation alive.
  std::shared_ptr<const StringPool> strings() const { return contents_.strings; }

  // Within TokenHolder::renewTokens(): the token of the new generation for one of the old.
  FieldToken renewed(FieldToken old);
  bool hasRoomForRenewal() const;

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

    // A text is interned, so its record stands for it.
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

  // Beside the reason in the value of what is malformed.
  static constexpr uint64_t kMalformedRequired = 0x100;
  // Below the kind in a token. The kinds leave the tokens of the store itself free.
  static constexpr int kIndexBits = 24;
  static_assert(FieldToken(FieldKind::boot) < kFirstReservedToken >> kIndexBits);

  static size_t indexOf(FieldToken token) { return token & ((1u << kIndexBits) - 1); }
  const Field& at(FieldToken token) const { return contents_.fields[indexOf(token)]; }
  static Field wholeField(FieldKind kind, uint64_t value);
  static Field malformedField(FieldKind kind, MalformedReason reason);
  static Contents emptyContents(const TracePointTableLimits& limits);
  FieldToken parse(FieldKind kind, std::string_view value);
  FieldToken parseNumber(FieldKind kind, std::string_view value);
  FieldToken parseId(std::string_view value);
  FieldToken parseAttribute(std::string_view value);
  FieldToken addAttribute(std::string_view key, std::string_view value);
  FieldToken textToken(FieldKind kind, std::string_view value);
  FieldToken add(const Field& field);
  FieldToken addOnce(const Field& field);
  bool holds(size_t share) const;
  FieldToken addAgain(const Field& old);

  const TracePointTableLimits limits_;
  TokenHolder* holder_ = nullptr;
  uint32_t generation_ = 0;
  bool grown_ = false;  // since the limits were looked at
  Contents contents_;
  Contents* old_ = nullptr;  // while tokens are renewed
  Id128 lastBoot_{};
  FieldToken lastBootToken_ = kNoToken;
};

}  // namespace tessel
