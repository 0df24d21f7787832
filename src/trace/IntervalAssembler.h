// IntervalAssembler: from the tokens of entries to trace objects.
//
// An event is delivered when it is read, an interval when its end is read. A begin and an end match
// when boot, subsystem, category, name and id are equal, and in process scope the process too. A
// second begin under the same key replaces the first. An end without a begin is counted. A field
// that the end lacks is taken from the begin; telemetry is on when either says so. An interval with
// a frame rate on either end is an animation interval.
//
// Nothing here looks at text. Pairing compares tokens, and objects borrow interned strings.
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

// Where assembled objects go.
class TraceObjectSink {
 public:
  virtual ~TraceObjectSink() = default;
  // Whether an object of this subsystem and category is to be made at all.
  virtual bool admits(StringRef subsystem, StringRef category) = 0;
  virtual void deliverEvent(std::shared_ptr<const TesselEvent> event) = 0;
  virtual void deliverInterval(std::shared_ptr<const TesselInterval> interval) = 0;
  virtual void deliverAnimationInterval(
      std::shared_ptr<const TesselAnimationInterval> interval) = 0;
};

struct AssemblyCounts {
  uint64_t tracePoints = 0;  // well-formed entries: events, begins, ends
  uint64_t events = 0;
  uint64_t pairedEnds = 0;  // ends that met their begin
  std::array<uint64_t, kMalformedReasons> malformed{};
  uint64_t withoutImagePath = 0;      // trace points without _EXE
  uint64_t unmatchedEnds = 0;         // ends whose begin was not read
  uint64_t replacedBegins = 0;        // begins that a second one with the same key replaced
  uint64_t droppedOpenIntervals = 0;  // open intervals beyond the limits
  uint64_t openIntervals = 0;         // begins that still wait for their end
};

// Adds those of them that are losses. Begins and ends that found no partner are none: the partner
// may be of the day before or after.
void addLosses(const AssemblyCounts& counts, Losses& losses);

class IntervalAssembler {
 public:
  // REQUIRES: table and sink outlive the assembler, and nobody else keeps tokens of the table.
  IntervalAssembler(TracePointTable& table, TraceObjectSink& sink, OpenIntervalLimits limits = {});
  IntervalAssembler(const IntervalAssembler&) = delete;
  IntervalAssembler& operator=(const IntervalAssembler&) = delete;

  // Takes in one entry. Afterwards its tokens are no longer good: where the table is full, it
  // starts a new generation.
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
