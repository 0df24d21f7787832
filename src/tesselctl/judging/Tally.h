// Tally: the figures of a dry run.
//
// Its memory is bounded. The extraction limits the distinct (subsystem, category) pairs. The tally
// itself limits the distinct values that the whitelist held back; it counts objects with further
// values together. Durations have bounds of their own. Threads: one at a time.

#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "journal/EntryStream.h"
#include "tesselctl/judging/Durations.h"
#include "tesselctl/judging/Judge.h"
#include "tesselctl/judging/KeyedCounts.h"
#include "tesselctl/reading/TimeArguments.h"

namespace tessel::ctl {

struct KindCounts {
  uint64_t reported = 0;
  uint64_t unreported = 0;
};

class Tally {
 public:
  static constexpr size_t kMaxMisses = 8192;
  static constexpr size_t kMaxMissBytes = size_t{2} << 20;
  static constexpr size_t kMaxSlices = 48;

  // `period` is divided into slices. Each slice has counts of its own.
  explicit Tally(const Period& period);

  void count(const TesselObject& object, const FilterDecision& decision, const EntryHeader& entry);

  struct Pair {
    std::string subsystem;
    std::string category;
    VerdictCounts counts{};
  };
  // A value that the whitelist held back, and its trace point. An absent string is empty here.
  struct Miss {
    std::string subsystem;
    std::string category;
    std::string name;
    uint8_t slot = 0;
    std::string value;
    uint64_t count = 0;
  };

  uint64_t traceObjects() const { return sumOf(verdicts_); }
  const VerdictCounts& verdicts() const { return verdicts_; }
  // In the order of `kinds`: "Event", "Interval", "AnimationInterval".
  static constexpr std::array<std::string_view, 3> kKinds = {"Event", "Interval",
                                                             "AnimationInterval"};
  const std::array<KindCounts, 3>& kinds() const { return kinds_; }
  // Most objects first.
  std::vector<Pair> pairs() const;
  // Most frequent first.
  std::vector<Miss> misses() const;
  // Objects that the whitelist held back and that misses() does not list.
  uint64_t missesNotListed() const { return missesNotListed_; }

  // Durations and frame rates of trace points, whatever their verdict: a point that is not reported
  // takes as long.
  const Durations& durations() const { return durations_; }

  // Equal parts of the period, in order; they begin at whole minutes, hours or days, local time.
  const std::vector<VerdictCounts>& slices() const { return slices_; }
  Date sliceStart(size_t slice) const {
    return firstSlice_ + sliceLength_ * static_cast<int64_t>(slice);
  }
  std::chrono::microseconds sliceLength() const { return sliceLength_; }
  const Period& period() const { return period_; }

 private:
  void countPair(const TesselObject& object, TesselReporterClassification classification);
  void countKind(const TesselObject& object, bool reported);
  void countSlice(TesselReporterClassification classification, uint64_t realtime);
  void countMiss(const TesselObject& object, const FilterDecision& decision);

  const Period period_;
  VerdictCounts verdicts_{};
  std::array<KindCounts, 3> kinds_{};
  KeyedCounts<2, VerdictCounts> pairs_;
  KeyedCounts<4, uint64_t> misses_;
  size_t missBytes_ = 0;
  uint64_t missesNotListed_ = 0;
  Durations durations_;
  std::chrono::microseconds sliceLength_;
  Date firstSlice_;
  std::vector<VerdictCounts> slices_;
};

}  // namespace tessel::ctl
