// IntervalAssembler makes trace objects from the tokens of journal entries.
//
// It delivers an event when it reads the entry, and an interval when it reads the interval's end. A
// begin and an end match if boot, subsystem, category, name and id are equal. In process scope the
// process must be equal too. A second begin with the same key replaces the first. An end without a
// begin is counted and delivers nothing. If the end lacks a field, the interval takes it from the
// begin. Telemetry is on if the begin or the end says so. An interval is an animation interval if
// its begin or its end has a frame rate.
//
// This class compares tokens and never reads text. The objects borrow the strings of the table.
//
// Threads: one at a time.

#pragma once

#include <array>
#include <memory>

#include "journal/EntryStream.h"
#include "objects/TesselObject.h"
#include "platform/Losses.h"
#include "trace/OpenIntervals.h"
#include "trace/TracePointTable.h"

namespace tessel {

// Receives the assembled objects.
class TraceObjectSink {
 public:
  virtual ~TraceObjectSink() = default;
  // Whether the assembler shall make an object of this subsystem and category.
  virtual bool admits(StringRef subsystem, StringRef category) = 0;
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

class IntervalAssembler {
 public:
  // REQUIRES: table and sink outlive the assembler. Nobody else keeps tokens of the table from one
  // consume() to the next.
  IntervalAssembler(TracePointTable& table, TraceObjectSink& sink, OpenIntervalLimits limits = {});
  IntervalAssembler(const IntervalAssembler&) = delete;
  IntervalAssembler& operator=(const IntervalAssembler&) = delete;

  // Takes in one entry. The caller must not use the entry's tokens afterwards, because a full table
  // starts a new generation here.
  void consume(const Entry& entry);
  AssemblyCounts counts() const;

 private:
  struct Point {
    PointTokens tokens;
    std::vector<FieldToken> attributes;
    FieldToken malformed;

    FieldToken operator[](FieldKind kind) const { return tokens[static_cast<size_t>(kind)]; }
  };

  void take(const Entry& entry);
  void startGeneration();
  bool meansToBeATracePoint(std::span<const FieldToken> tokens) const;
  void read(std::span<const FieldToken> tokens);
  std::optional<MalformedReason> fault() const;
  void emitEvent();
  void begin(const EntryHeader& header);
  void end(const EntryHeader& header);
  void deliverMerged(const PointTokens& begin, const std::vector<FieldToken>& attributes,
                     float measuredSeconds);
  IntervalKey keyOf(const EntryHeader& header);
  TracePointFields fieldsOf(const PointTokens& tokens, float measuredSeconds) const;
  EmittingProcess processOf(const PointTokens& tokens) const;
  void appendAttributes(const std::vector<FieldToken>& tokens, IntervalFields& interval) const;

  TracePointTable& table_;
  TraceObjectSink& sink_;
  OpenIntervals open_;
  Point point_{};
  AssemblyCounts counts_;
};

}  // namespace tessel
