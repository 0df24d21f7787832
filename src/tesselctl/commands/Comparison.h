// The comparison of two settings: what one would report and the other would not, and over two
// periods how long each trace point took.
//
// Over one period both settings judge the same objects, so we can say for each object what changes.
// That needs one reading of the store. Over two periods the objects differ and cannot be matched.
// There we compare trace points instead: which ones only one period reports, and how long each
// takes in both. Threads: one at a time.

#pragma once

#include <algorithm>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/Durations.h"

namespace tessel::ctl {

// One side of the comparison.
struct Setting {
  JudgedMachine machine;
  Period period;
};

// What stands in the place of a verdict where a period has no such trace point.
inline constexpr char kNotRecorded[] = "not_recorded";

// A trace point that one side reports and the other does not, with the reason of the other side.
struct Change {
  bool starts = false;  // reported by the second side alone
  std::string subsystem;
  std::string category;
  std::string name;
  std::string why;  // verdict of the other side; kNotRecorded if it met no such object
  // The text that the whitelist held back: its slot, 1 or 2, and its value. 0 for another reason.
  uint8_t slot = 0;
  std::string value;

  // NOLINTNEXTLINE(modernize-use-nullptr): the 0 is the compiler's own
  auto operator<=>(const Change&) const = default;
};

// Counts of distinct changes. Each object may bring a new value, so the list has the same bound as
// the list of `explain --summary`. Objects beyond it are counted together, so the listed counts and
// notListed() add up to starting() and stopping().
class Changes {
 public:
  static constexpr size_t kMost = 8192;

  void add(const Change& change, uint64_t count) {
    (change.starts ? starting_ : stopping_) += count;
    const auto known = counts_.find(change);
    if (known != counts_.end()) {
      known->second += count;
    } else if (counts_.size() < kMost) {
      counts_.emplace(change, count);
    } else {
      notListed_ += count;
    }
  }
  std::vector<std::pair<Change, uint64_t>> listed() const {
    std::vector<std::pair<Change, uint64_t>> changes(counts_.begin(), counts_.end());
    // Starts first, then most objects first. A stable sort keeps names in order among equals.
    std::stable_sort(changes.begin(), changes.end(), [](const auto& a, const auto& b) {
      return std::make_pair(!a.first.starts, b.second) < std::make_pair(!b.first.starts, a.second);
    });
    return changes;
  }
  uint64_t starting() const { return starting_; }
  uint64_t stopping() const { return stopping_; }
  uint64_t notListed() const { return notListed_; }

 private:
  std::map<Change, uint64_t> counts_;
  uint64_t starting_ = 0;
  uint64_t stopping_ = 0;
  uint64_t notListed_ = 0;
};

// What only a comparison of two periods knows of each. Over one period both sides have the same
// objects, which take as long.
struct ComparedPeriod {
  Durations durations;
  StoreReading reading;
};

// The verdicts of both settings on a store, and the changes between them.
struct Comparison {
  VerdictCounts sides[2] = {};
  Changes changes;
  uint64_t notCompared = 0;  // objects of trace points that PointFigures has no room for
  std::optional<ComparedPeriod> periods[2];
  std::optional<PlatformError> error;
  StoreReport unread;  // the files that any reading was refused, and the most that one left out
  Losses losses;       // of each reading
};

bool samePeriod(const Setting (&settings)[2]);
// Reads the store once, or once for each period if they differ.
Comparison compared(const Setting (&settings)[2], const std::optional<std::string>& store);

}  // namespace tessel::ctl
