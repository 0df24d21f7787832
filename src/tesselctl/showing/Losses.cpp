// The words for losses.

#include "tesselctl/showing/Losses.h"

#include <algorithm>

#include "platform/Text.h"
#include "tesselctl/reading/TimeArguments.h"

namespace tessel::ctl {

namespace {

constexpr size_t kShownOfAKind = 5;

std::string entries(uint64_t count) { return count == 1 ? "entry" : "entries"; }

std::string droppedOf(uint64_t count, const std::string& units) {
  return entries(count) + " that the journal daemon dropped, of " + units;
}

std::vector<Loss> summedLosses(const StoreReport& store, uint64_t withoutImagePath) {
  return thoseThatOccurred(
      {{store.filesNotLookedAt, "files that were too many to look at"},
       {store.missingEntries, entries(store.missingEntries) + ", by " +
                                  counted(store.sequenceGaps, "gap", "gaps") +
                                  " in the sequence numbers"},
       {withoutImagePath, "_EXE of trace points, whose process was gone too soon"}});
}

std::vector<Loss> droppedEntries(const StoreReport& store) {
  std::vector<Loss> losses;
  for (const auto& [unit, count] : store.dropped)
    losses.push_back({count, droppedOf(count, unit.empty() ? "no unit" : unit)});
  return losses;
}

std::vector<std::string> inWords(const std::vector<Loss>& losses) {
  std::vector<std::string> lines;
  lines.reserve(losses.size());
  for (const Loss& loss : losses) lines.push_back(grouped(loss.count) + " " + loss.what);
  return lines;
}

// Appends the first of `kind`; says how many more there are, `notListed` among them.
void addShown(std::vector<std::string>& lines, const std::vector<std::string>& kind,
              uint64_t notListed = 0) {
  const size_t shown = std::min(kind.size(), kShownOfAKind);
  lines.insert(lines.end(), kind.begin(), kind.begin() + static_cast<std::ptrdiff_t>(shown));
  const uint64_t further = kind.size() - shown + notListed;
  if (further != 0) lines.push_back("... and " + grouped(further) + " more of this kind");
}

std::string damageWords(const StoreProblem& problem) {
  return problem.reason + ", " + counted(problem.count, "time", "times") +
         (problem.files == 1 ? "" : " in " + grouped(problem.files) + " files") +
         ", first at byte " + grouped(problem.firstPlace) + " of " + problem.path;
}

}  // namespace

std::vector<Loss> thoseThatOccurred(std::vector<Loss> losses) {
  std::erase_if(losses, [](const Loss& loss) { return loss.count == 0; });
  return losses;
}

std::vector<Loss> entryLosses(const MalformedCounts& malformed, uint64_t droppedOpenIntervals,
                              uint64_t beyondPairLimit) {
  std::vector<Loss> losses;
  for (const auto& [reason, count] : malformed) losses.push_back({count, "malformed: " + reason});
  losses.push_back({droppedOpenIntervals, "a begin that was one too many to wait"});
  losses.push_back({beyondPairLimit, "of a subsystem and category that were one pair too many"});
  return thoseThatOccurred(std::move(losses));
}

std::vector<Loss> storeLosses(const StoreReport& store, uint64_t withoutImagePath) {
  std::vector<Loss> losses = summedLosses(store, withoutImagePath);
  const std::vector<Loss> dropped = droppedEntries(store);
  losses.insert(losses.end(), dropped.begin(), dropped.end());
  return losses;
}

std::string partOfPeriod(const StoreReport& store) {
  if (!store.oldestEntry || store.reachesRangeStart()) return {};
  const Date oldest{std::chrono::microseconds{static_cast<int64_t>(*store.oldestEntry)}};
  return "The store reaches back to " + dateText(oldest) + " only";
}

std::vector<std::string> wordsForLosses(const ReadingDigest& reading) {
  std::vector<std::string> lines = inWords(summedLosses(reading.store, reading.withoutImagePath));
  if (std::string part = partOfPeriod(reading.store); !part.empty())
    lines.insert(lines.begin(), std::move(part));
  addShown(lines, inWords(droppedEntries(reading.store)));
  if (const uint64_t further = reading.droppedNotListed; further != 0)
    lines.push_back(grouped(further) + " " + droppedOf(further, "further units"));
  std::vector<std::string> files;
  for (const FileReport& file : reading.store.files)
    files.push_back(whyNotRead(file) + ": " + file.path);
  addShown(lines, files, reading.filesNotListed);
  std::vector<std::string> damage;
  for (const StoreProblem& problem : reading.problems) damage.push_back(damageWords(problem));
  addShown(lines, damage);
  for (const Loss& loss :
       entryLosses(reading.malformed, reading.droppedOpenIntervals, reading.beyondPairLimit)) {
    lines.push_back("no trace object came of " + counted(loss.count, "entry", "entries") + ": " +
                    loss.what);
  }
  return lines;
}

std::string whyNotRead(const FileReport& file) { return "not read: " + file.skipped.value_or(""); }

}  // namespace tessel::ctl
