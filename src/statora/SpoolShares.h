// Shares of the spool: what a run may take of it, and what each rank of its rows leaves to the
// higher ones. All in pages, and all plain arithmetic.

#pragma once

#include <algorithm>
#include <cstdint>

#include "platform/Analytics.h"

namespace tessel {

// Pages that an insert may write beside those of the row: where a page of the tree is split, and
// the table that remembers the last id.
inline constexpr int64_t kPagesBesideRow = 3;

// A run may take an eighth of what is free when it begins. So each run that floods the spool leaves
// seven eighths of what it has found to the next one. The price is that a run's part shrinks: after
// 30 floods in a row, when the rows of the first are past their days, a run may still take 2.3 MiB
// of a spool of 1 GiB. A spool of 4 MiB has no room for objects after 17. An eighth of the limit
// was discarded, because the floods of eight days would fill the spool for a month.
inline constexpr int64_t kRunShare = 8;

// Pages that the rows of the summary need: one row of statistics, shorter than a page, and at most
// 30 counts. A count whose subsystem and category are as long as they may be takes 13 pages. Where
// 30 of these would be more than an eighth of what the run may take, an eighth is kept for them.
inline constexpr int64_t kForStatistics = 2 + kPagesBesideRow;
inline constexpr int64_t kMostForCounts = 30 * 13;
inline constexpr int64_t kLeastForCounts = 8;

// Pages that a row must leave free, for those of a higher rank.
inline int64_t pagesKeptFrom(EventRank rank, int64_t pagesOfRun) {
  if (rank == EventRank::statistics) return 0;
  if (rank == EventRank::count) return kForStatistics;
  return kForStatistics + std::clamp(pagesOfRun / 8, kLeastForCounts, kMostForCounts);
}

// Pages that a run may take of so many that are free. Even in a full spool the summary may use what
// is kept for it; nothing is left to the objects then.
inline int64_t shareOf(int64_t freePages) {
  return std::max(freePages / kRunShare, kForStatistics + kLeastForCounts);
}

inline int64_t pagesForObjects(int64_t pagesOfRun) {
  return pagesOfRun - pagesKeptFrom(EventRank::object, pagesOfRun);
}

}  // namespace tessel
