// Reading the store under two settings, and finding what differs.

#include "tesselctl/commands/Comparison.h"

namespace tessel::ctl {

namespace {

std::string textOf(StringRef text) { return std::string(text.textOr("")); }

// Two periods may read different files, so the losses of both readings are added up. A file that
// neither could read is one file all the same.
void takeReading(const DryRun& run, Comparison& comparison) {
  const StoreReport& read = run.report().store;
  comparison.losses.add(read.reading.losses);
  const auto leftOut = [](const StoreReport& report) {
    return report.reading.losses.sum(LossCode::filesNotLookedAt);
  };
  if (leftOut(read) >= leftOut(comparison.unread)) comparison.unread.reading = read.reading;
  std::vector<FileReport>& refused = comparison.unread.files;
  for (const FileReport& file : read.files) {
    const auto same = [&](const FileReport& other) { return other.path == file.path; };
    const bool wanted = file.refused || file.path == kStandardInputName;
    if (wanted && std::ranges::none_of(refused, same)) refused.push_back(file);
  }
}

// One period, two judges.
void compareJudges(const Setting (&settings)[2], const std::optional<std::string>& store,
                   Comparison& comparison) {
  Judge judges[2] = {Judge(settings[0].machine), Judge(settings[1].machine)};
  DryRun run(store, [&](const TesselObject& object, const EntryHeader&) {
    const FilterDecision decisions[2] = {judges[0].inspect(object), judges[1].inspect(object)};
    for (size_t side = 0; side < 2; ++side)
      ++comparison.sides[side][decisions[side].classification];
    if (decisions[0].shouldReport() == decisions[1].shouldReport()) return true;
    const bool starts = decisions[1].shouldReport();
    // Only the side that holds the object back has a reason.
    const FilterDecision& held = decisions[starts ? 0 : 1];
    comparison.changes.add(
        {starts, textOf(object.subsystem()), textOf(object.category()), textOf(object.name()),
         std::string(verdictName(held.classification)), held.stringSlot, textOf(held.stringValue)},
        1);
    return true;
  });
  comparison.error = readWithProgress(run, settings[0].period);
  takeReading(run, comparison);
}

// What became of each trace point in two periods.
class PointFigures {
 public:
  // A program that puts numbers into its names makes new trace points without end. Objects beyond
  // these bounds count in the sums of their side, but no change is found for them.
  static constexpr size_t kMost = 65536;
  static constexpr size_t kMostBytes = size_t{16} << 20;  // of subsystems, categories and names

  struct Sides {
    VerdictCounts counts[2] = {};
  };
  using Points = KeyedCounts<3, Sides>;

  // False if there is no room for the trace point of the object.
  bool count(const TesselObject& object, size_t side, TesselReporterClassification verdict) {
    const Points::Key key{{object.subsystem(), object.category(), object.name()}};
    Sides* sides = points_.find(key);
    if (sides == nullptr) {
      size_t bytes = bytes_;
      for (const StringRef text : key.texts) bytes += text.textOr("").size();
      if (points_.entries().size() >= kMost || bytes > kMostBytes) return false;
      bytes_ = bytes;
      sides = &points_.add(key);
    }
    ++sides->counts[side][verdict];
    return true;
  }
  const std::vector<Points::Entry>& entries() const { return points_.entries(); }

 private:
  Points points_;
  size_t bytes_ = 0;
};

// The verdict that held back most objects.
std::string mainReason(const VerdictCounts& counts) {
  if (sumOf(counts) == 0) return kNotRecorded;
  // The first verdict is "reported", which is no reason. Among equal counts the first verdict wins,
  // so the answer does not depend on the order of the store.
  auto main = kVerdictOrder[1];
  for (const auto verdict : kVerdictOrder) {
    if (verdict != TesselReporterClassificationTelemetryReported && counts[verdict] > counts[main])
      main = verdict;
  }
  return std::string(verdictName(main));
}

// Two periods, each with a judge of its own. A judge that went on would have used up caps in the
// first period, and points of the second would seem to stop.
void comparePeriods(const Setting (&settings)[2], const std::optional<std::string>& store,
                    Comparison& comparison) {
  PointFigures points;
  // After an error the second reading is skipped: the command fails and shows no figures.
  for (size_t side = 0; side < 2 && !comparison.error; ++side) {
    Judge judge(settings[side].machine);
    ComparedPeriod& period = comparison.periods[side].emplace();
    if (side == 1) period.durations.expect(comparison.periods[0]->durations);
    DryRun run(store, [&](const TesselObject& object, const EntryHeader&) {
      const auto verdict = judge.inspect(object).classification;
      ++comparison.sides[side][verdict];
      period.durations.count(object);
      if (!points.count(object, side, verdict)) ++comparison.notCompared;
      return true;
    });
    // Each period is half of the work on the progress bar.
    const double half = static_cast<double>(side) / 2;
    comparison.error = readWithProgress(run, settings[side].period, true, half, half + 0.5);
    takeReading(run, comparison);
    period.reading = run.report().store.reading;
  }
  for (const auto& [texts, slot, figures] : points.entries()) {
    const uint64_t before = figures.counts[0][TesselReporterClassificationTelemetryReported];
    const uint64_t after = figures.counts[1][TesselReporterClassificationTelemetryReported];
    // Traffic differs from day to day. So a change is only a point that was reported in one period
    // and not once in the other.
    if ((before == 0) == (after == 0)) continue;
    const bool starts = before == 0;
    comparison.changes.add({starts, textOf(texts[0]), textOf(texts[1]), textOf(texts[2]),
                            mainReason(figures.counts[starts ? 0 : 1]), 0, ""},
                           starts ? after : before);
  }
}

}  // namespace

bool samePeriod(const Setting (&settings)[2]) {
  const auto& [a, b] = settings;
  return a.period.start == b.period.start && a.period.end == b.period.end;
}

Comparison compared(const Setting (&settings)[2], const std::optional<std::string>& store) {
  Comparison comparison;
  (samePeriod(settings) ? compareJudges : comparePeriods)(settings, store, comparison);
  return comparison;
}

}  // namespace tessel::ctl
