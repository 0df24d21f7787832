// Shares: divides among the writers what a run has only once: pairs, executables, the text that
// goes to the spool, time, and counters of losses at the source.
//
// What is given away cannot be taken back, so the last quarter of each total is kept for those who
// come late: it goes only to users who hold less than a sixteenth of the total. Among the
// programs of one user the same rule holds once more: of the three quarters that are open to every
// user, the last quarter goes only to programs that hold less than a sixteenth of them. So a
// program that takes what it can leaves seven sixteenths of the total to others: three to the other
// programs of its user, and four to other users. Nothing has to be tuned, and as long as nine
// sixteenths of a total suffice for everybody, nobody is refused anything.
//
// We discarded equal parts for all, because nobody knows beforehand how many writers will come. We
// discarded sorting the day by writer before anything is delivered, because a day does not fit into
// memory.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <optional>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/Losses.h"
#include "trace/SourceLosses.h"
#include "trace/TracePointTable.h"
#include "trace/Writers.h"

namespace tessel {

inline constexpr uint64_t kNoLimit = std::numeric_limits<uint64_t>::max();

// At its end a run spends time and memory on each (subsystem, category) pair. For each executable
// the process looks for a bundle, and remembers what it found. A writer may make up any number of
// either. A machine full of programs has fewer than 4,096 of both. 4 MiB of text leave 1 KiB for
// each.
struct ShareLimits {
  uint64_t pairs = 4096;
  uint64_t pairBytes = uint64_t{4} << 20;  // of all subsystems and categories together
  uint64_t images = 4096;
  uint64_t imageBytes = uint64_t{4} << 20;  // of all paths together
  uint64_t rowBytes = kNoLimit;             // of the spool, for the rows of objects
  // What a row with so many bytes of text takes of rowBytes.
  uint64_t (*spaceOfRow)(size_t textBytes) = [](size_t textBytes) -> uint64_t { return textBytes; };
  uint64_t nanoseconds = kNoLimit;  // that a run may take
  uint64_t counters = SourceLosses::kMaxCounters;
};

// An object before it is made: the tokens that it will be made of. For an event both are the same.
// Whoever ends an interval makes us deliver it, so the object counts for the writer of the end. He
// cannot choose what runs at its begin, so that executable counts for the writer of the begin.
struct ObjectOffer {
  TracePointTable& table;
  const PointTokens& begin;
  const PointTokens& end;

  // Subsystem and category. Begin and end of an interval agree on both.
  uint64_t pair() const {
    return uint64_t{tokenOf(end, FieldKind::subsystem)} << 32 | tokenOf(end, FieldKind::category);
  }
  StringRef subsystem() const { return table.text(tokenOf(end, FieldKind::subsystem)); }
  StringRef category() const { return table.text(tokenOf(end, FieldKind::category)); }
  bool telemetryEnabled() const {
    return table.flag(tokenOf(begin, FieldKind::telemetry)) ||
           table.flag(tokenOf(end, FieldKind::telemetry));
  }
  std::array<FieldToken, 2> images() const {
    return {tokenOf(begin, FieldKind::imagePath), tokenOf(end, FieldKind::imagePath)};
  }
  bool imagesAreNoted() const { return table.noted(images()[0]) && table.noted(images()[1]); }
  Origin writer() const { return writerOf(table, end); }
};

class Shares {
 public:
  // REQUIRES: `writers` outlives the shares.
  Shares(Writers& writers, const ShareLimits& limits);

  // Whether the object may be delivered. Takes what the object needs, except for text and time,
  // whose true cost only shows once it was delivered. A refusal is noted as a loss of its writer.
  bool admits(const ObjectOffer& offer) {
    // Nearly every object brings nothing new, while there is enough of everything.
    if (offer.table.generation() == generation_ && recentPair(offer) == offer.pair() &&
        (!offer.telemetryEnabled() || offer.imagesAreNoted()) && !scarce_) [[likely]]
      return true;
    return weighs(offer);
  }
  // Whether the writer may have one more counter of losses. Takes it.
  bool admitsCounter(const Origin& writer);
  // Adds what the delivery of an admitted object has cost.
  void charge(const Origin& writer, uint64_t rowBytes, uint64_t nanoseconds);

  uint64_t refusals() const { return refusals_; }
  // Distinct pairs that were admitted.
  uint64_t pairs() const { return pairs_.keys.size(); }

 private:
  enum Kind : size_t {
    kPairs,
    kPairBytes,
    kImages,
    kImageBytes,
    kRowBytes,
    kTime,
    kCounters,
    kKinds
  };
  using Amounts = std::array<uint64_t, kKinds>;
  // What was admitted, by two hashes. The hashes are seeded, so a writer cannot make up two texts
  // that share one, and no text has to be kept.
  struct Key {
    uint64_t first = 0;
    uint64_t second = 0;
    bool operator==(const Key&) const = default;
  };
  struct Admitted {
    std::vector<Key> keys;
    FlatIndex index;  // of keys
  };

  uint64_t& recentPair(const ObjectOffer& offer) {
    const uint64_t pair = offer.pair();
    return recentPairs_[((pair >> 32) * 37 + pair) % kRecentPairs];
  }
  struct Refusal {
    LossCode reason;
    Origin writer;  // who had more than his share
  };
  bool weighs(const ObjectOffer& offer);
  uint64_t spaceOf(const ObjectOffer& offer) const;
  void noteScarcity();
  std::optional<Refusal> refusal(const ObjectOffer& offer);
  bool imageIsAdmitted(TracePointTable& table, FieldToken image, const Origin& writer);
  bool hasOrTakes(Admitted& admitted, Key key, uint64_t bytes, Kind count, Kind text,
                  const Origin& writer);
  bool mayTake(Kind kind, uint64_t amount, const Origin& writer) {
    return given_[kind] + amount <= openToAll_[kind] || mayTakeScarce(kind, amount, writer);
  }
  bool mayTakeScarce(Kind kind, uint64_t amount, const Origin& writer);
  void take(Kind kind, uint64_t amount, uint32_t writer);

  Writers& writers_;
  const Amounts limits_;
  uint64_t (*const spaceOfRow_)(size_t);
  Amounts openToAll_{};  // up to here nobody's share is looked at
  Amounts given_{};
  std::vector<Amounts> byUser_;
  std::vector<Amounts> byWriter_;
  bool scarce_ = false;  // whether the next object may take more text or time than openToAll_
  Admitted pairs_;
  Admitted images_;
  // The last pairs that were admitted, by their tokens, and the generation of these. A comparison
  // costs a quarter of a search.
  static constexpr size_t kRecentPairs = 4096;
  std::vector<uint64_t> recentPairs_ = std::vector<uint64_t>(kRecentPairs);
  uint32_t generation_ = 0;
  uint64_t refusals_ = 0;
};

}  // namespace tessel
