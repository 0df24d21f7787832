// Cutting a report down.

#include "linux/ReadingDigest.h"

#include <algorithm>
#include <string_view>

#include "platform/Text.h"

namespace tessel {

namespace {

std::string shortText(std::string_view text) {
  return shortPlainText(text, ReadingDigest::kMaxTextBytes);
}

StoreProblem& entryFor(std::vector<StoreProblem>& problems, std::string_view reason) {
  const auto named = [&](std::string_view name) {
    return std::find_if(problems.begin(), problems.end(),
                        [&](const StoreProblem& known) { return known.reason == name; });
  };
  auto known = named(reason);
  if (known == problems.end() && problems.size() + 1 >= ReadingDigest::kMaxListed)
    known = named(reason = "other");
  if (known != problems.end()) return *known;
  problems.emplace_back().reason = reason;
  return problems.back();
}

void addProblems(std::vector<StoreProblem>& problems, const FileReport& file) {
  for (const FileProblem& problem : file.problems) {
    StoreProblem& entry = entryFor(problems, shortText(problem.reason));
    if (entry.files == 0) {
      entry.path = shortText(file.path);
      entry.firstPlace = problem.firstPlace;
    }
    ++entry.files;
    entry.count += problem.count;
  }
}

void addFile(ReadingDigest& digest, const FileReport& file) {
  addProblems(digest.problems, file);
  if (!file.skipped) {
    ++digest.filesRead;
  } else if (file.outsideRange) {
    ++digest.filesOutsideRange;
  } else if (digest.store.files.size() == ReadingDigest::kMaxListed) {
    ++digest.filesNotListed;
  } else {
    FileReport& listed = digest.store.files.emplace_back();
    listed.path = shortText(file.path);
    listed.skipped = shortText(*file.skipped);
  }
}

void addDropped(ReadingDigest& digest, std::vector<DroppedEntries> dropped) {
  if (dropped.size() > ReadingDigest::kMaxListed) {
    std::stable_sort(
        dropped.begin(), dropped.end(),
        [](const DroppedEntries& a, const DroppedEntries& b) { return a.count > b.count; });
  }
  for (const DroppedEntries& entries : dropped) {
    if (digest.store.dropped.size() == ReadingDigest::kMaxListed) {
      digest.droppedNotListed += entries.count;
    } else {
      digest.store.dropped.push_back({shortText(entries.unit), entries.count});
    }
  }
}

}  // namespace

ReadingDigest digestOf(const ExtractionReport& report) {
  ReadingDigest digest;
  digest.malformed = malformedCounts(report);
  digest.droppedOpenIntervals = report.assembly.droppedOpenIntervals;
  digest.beyondPairLimit = report.beyondPairLimit;
  digest.withoutImagePath = report.assembly.withoutImagePath;
  digest.store.entriesRead = report.store.entriesRead;
  digest.store.duplicateEntries = report.store.duplicateEntries;
  digest.store.oldestEntry = report.store.oldestEntry;
  digest.store.rangeStart = report.store.rangeStart;
  digest.store.sequenceGaps = report.store.sequenceGaps;
  digest.store.missingEntries = report.store.missingEntries;
  digest.store.filesNotLookedAt = report.store.filesNotLookedAt;
  for (const FileReport& file : report.store.files) addFile(digest, file);
  addDropped(digest, report.store.dropped);
  return digest;
}

}  // namespace tessel
