// IntervalAssembler makes trace objects from the tokens of journal entries.
//
// It delivers an event when it reads the entry, and an interval when it reads the interval's end. A
// begin and an end match if boot, subsystem, category, name and id are equal. In process scope the
// process must be equal too. A second begin with the same key replaces the first. An end without a
// begin is counted and delivers nothing. If the end lacks a field, the interval takes it from the
// begin. Telemetry is on if the begin or the end says so. An interval is an animation interval if
// its begin or its end has a frame rate. If an entry states a field more than once, the greatest
// value counts, because the journal does not keep the order in which a writer states fields.
//
// This class compares tokens and never reads text. The objects borrow the strings of the table.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <functional>
#include <memory>
#include <optional>

#include "journal/EntryStream.h"
#include "objects/TesselObject.h"
#include "platform/Losses.h"
#include "trace/OpenIntervals.h"
#include "trace/Shares.h"
#include "trace/SourceLosses.h"
#include "trace/TracePointTable.h"

namespace tessel {

// Receives the assembled objects.
class TraceObjectSink {
 public:
  virtual ~TraceObjectSink() = default;
  // Whether the assembler shall make the object. If so, it delivers it next.
  virtual bool admits(const ObjectOffer& offer) = 0;
  // An entry tells what its program lost so far.
  virtual void addTold(const ToldLosses& told) = 0;
  virtual void deliverEvent(std::shared_ptr<const TesselEvent> event) = 0;
  virtual void deliverInterval(std::shared_ptr<const TesselInterval> interval) = 0;
  virtual void deliverAnimationInterval(
      std::shared_ptr<const TesselAnimationInterval> interval) = 0;
};

struct AssemblyCounts {
  uint64_t tracePoints = 0;  // well-formed entries: events, begins, ends
  uint64_t events = 0;
  uint64_t pairedEnds = 0;  // ends that matched an open begin
  std::array<uint64_t, kMalformedReasons> malformed{};
  uint64_t withoutImagePath = 0;      // trace points without a usable _EXE
  uint64_t unmatchedEnds = 0;         // ends that matched no open begin
  uint64_t replacedBegins = 0;        // begins that a second one with the same key replaced
  uint64_t droppedOpenIntervals = 0;  // begins that OpenIntervals dropped for lack of room
  uint64_t openIntervals = 0;         // begins that still wait for their end
};

// Adds the counts that stand for losses. A begin or an end without a partner is no loss, because
// the partner may lie in the day before or after.
void addLosses(const AssemblyCounts& counts, Losses& losses);

// The process that wrote an entry, as the journal daemon saw it. Either may be absent.
struct EntryProcess {
  std::optional<uint32_t> id;
  std::optional<uint32_t> user;
};

class IntervalAssembler {
 public:
  // REQUIRES: table, writers and sink outlive the assembler. Nobody else keeps tokens of the table
  // from one consume() to the next.
  IntervalAssembler(TracePointTable& table, Writers& writers, TraceObjectSink& sink,
                    OpenIntervalLimits limits = {});
  IntervalAssembler(const IntervalAssembler&) = delete;
  IntervalAssembler& operator=(const IntervalAssembler&) = delete;

  // Takes in one entry. The caller must not use the entry's tokens afterwards, because a full table
  // starts a new generation here.
  void consume(const Entry& entry);
  AssemblyCounts counts() const;
  // The subsystem, category and name of each begin that waits for its end. The name may be absent.
  // All are borrowed until the next consume().
  using OpenVisitor = std::function<void(StringRef subsystem, StringRef category, StringRef name)>;
  void forEachOpen(const OpenVisitor& visit) const;
  // The writer of the current entry. REQUIRES: called by the sink.
  Origin writer() const { return writerOf(table_, point_.tokens); }
  // The process of the current entry. Objects do not have it: a run needs no more than its name,
  // and two more values would slow down every object. REQUIRES: called by the sink.
  EntryProcess process() const {
    // A process is numbered in 22 bits, so a number that can be a user's can be its own.
    return {table_.user(point_[FieldKind::process]), table_.user(point_[FieldKind::user])};
  }

 private:
  struct Point {
    PointTokens tokens;
    std::vector<FieldToken> attributes;
    FieldToken malformed;
    uint64_t lost;  // the greatest total that the entry tells; 0: none
    uint64_t lostSince;

    FieldToken operator[](FieldKind kind) const { return tokens[static_cast<size_t>(kind)]; }
  };

  struct RecentWriter {
    FieldToken image = kNoToken;
    FieldToken user = kNoToken;
    FieldToken owner = kNoToken;
    uint32_t number = FlatIndex::kNone;

    bool operator==(const RecentWriter&) const = default;
  };

  void take(const Entry& entry);
  void startGeneration();
  bool meansToBeATracePoint(std::span<const FieldToken> tokens) const;
  void tellLosses(const EntryHeader& header);
  void read(std::span<const FieldToken> tokens);
  void readRepeated(std::span<const FieldToken> tokens);
  FieldToken lesserFault(FieldToken a, FieldToken b) const;
  std::optional<MalformedReason> fault() const;
  void emitEvent();
  void begin(const EntryHeader& header);
  void end(const EntryHeader& header);
  void deliverMerged(const PointTokens& begin, const std::vector<FieldToken>& attributes,
                     float measuredSeconds);
  uint32_t writerNumber();
  IntervalKey keyOf(const EntryHeader& header);
  TracePointFields fieldsOf(const PointTokens& tokens, float measuredSeconds) const;
  EmittingProcess processOf(const PointTokens& tokens) const;
  void appendAttributes(const std::vector<FieldToken>& tokens, IntervalFields& interval) const;

  TracePointTable& table_;
  Writers& writers_;
  TraceObjectSink& sink_;
  OpenIntervals open_;
  Point point_{};
  // By the token of the image. Valid within one generation.
  static constexpr size_t kRecentWriters = 1024;
  std::array<RecentWriter, kRecentWriters> recentWriters_{};
  AssemblyCounts counts_;
};

}  // namespace tessel
