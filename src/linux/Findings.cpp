// The warnings of a run, in the order in which they weigh.
//
// Each text begins with words of its own. By these words linux/LogSinks.cpp finds the identifier
// under which `journalctl -x` explains the line, so they must stand in both places.

#include "linux/Findings.h"

#include <algorithm>

#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// A path of the journal takes some 100 bytes. With 256 for each foreign text a line stays below
// 1 KiB, so the journal keeps it whole and a terminal shows it on a few rows.
constexpr size_t kMaxForeignTextBytes = 256;
// A run knows fewer reasons and set-aside files. The bound matters for a record that was read from
// a file.
constexpr size_t kMaxOfAKind = 16;
constexpr std::string_view kObjectsLost = "Writers had more than their share, objects lost: ";

// Codes that stand side by side and have one reason share a line. Losses whose code is not here
// cost nobody a trace point: a point whose executable is unknown is reported under another name.
constexpr struct {
  LossCode first, last;
  std::string_view warning;
  std::string_view beginning;
} kLossWarnings[] = {
    {LossCode::fileSkipped, LossCode::filesNotLookedAt, "store_unreadable",
     "Files of the trace store were not read: "},
    {LossCode::fileDamaged, LossCode::fileDamaged, "store_damaged", "The trace store is damaged: "},
    {LossCode::droppedByDaemon, LossCode::droppedByDaemon, "dropped_by_daemon",
     "The journal daemon dropped entries: "},
    {LossCode::entriesMissing, LossCode::entriesMissing, "numbers_in_no_file",
     "Entries are in no file of the trace store: "},
    {LossCode::malformed, LossCode::malformed, "malformed", "Trace points were malformed: "},
    // Begins and objects are different things, so a sum of both would mean nothing. Five lines at
    // most, however many writers there are.
    {LossCode::openIntervalDropped, LossCode::openIntervalDropped, "over_share",
     "Writers had more than their share, begins lost: "},
    {LossCode::beyondPairLimit, LossCode::beyondPairLimit, "over_share", kObjectsLost},
    {LossCode::beyondImageLimit, LossCode::beyondImageLimit, "over_share", kObjectsLost},
    {LossCode::beyondTextLimit, LossCode::beyondTextLimit, "over_share", kObjectsLost},
    {LossCode::beyondTimeLimit, LossCode::beyondTimeLimit, "over_share", kObjectsLost},
};

std::string escaped(std::string_view text) { return shortPlainText(text, kMaxForeignTextBytes); }

std::string joined(const std::vector<std::string>& names) {
  std::string list;
  for (size_t at = 0; at < std::min(names.size(), kMaxOfAKind); ++at)
    list += (at == 0 ? "" : ", ") + names[at];
  return escaped(list);
}

std::string unreadWords(const RunRecord& record) {
  if (!record.reading) return "its day was not read to the end";
  constexpr uint64_t kMinute = 60'000'000;
  // Rounded up: a minute that was read in part was not read.
  const uint64_t minutes = (record.reading->unread() + kMinute - 1) / kMinute;
  return "the last " + std::to_string(minutes) + " minutes of its day were not read";
}

void addOutcome(std::vector<RunWarning>& warnings, const RunRecord& record) {
  if (record.outcome == RunOutcome::failed) {
    warnings.push_back({"run_failed", "The run failed: " + escaped(record.failure)});
  } else if (record.outcome == RunOutcome::bailedOut) {
    warnings.push_back({"bailed_out",
                        "The run read nothing, because an earlier run died: the run "
                        "marker was there when it began"});
  } else if (record.outcome == RunOutcome::interrupted) {
    warnings.push_back({"run_cut_short", "The run was cut short: " + unreadWords(record)});
  }
  if (record.marker == "still there") {
    warnings.push_back({"marker_stuck",
                        "The run marker could not be removed: the next run will "
                        "take this one for dead and read nothing"});
  }
}

void addRows(std::vector<RunWarning>& warnings, const RunRecord& record) {
  uint64_t refused = 0;
  size_t reasons = 0;
  for (const auto& [reason, rows] : record.rowsFailed) {
    refused += rows;
    if (rows == 0 || ++reasons > kMaxOfAKind) continue;
    warnings.push_back({"rows_refused",
                        "The spool refused rows of the run: " + std::to_string(rows) + " of " +
                            std::to_string(record.rowsExpected()) + ", reason " + escaped(reason)});
  }
  if (record.hasBooks() && record.rowsStored + refused != record.rowsExpected()) {
    warnings.push_back(
        {"books_unbalanced",
         "The books of the run do not balance: " + std::to_string(record.rowsStored) +
             " rows stored and " + std::to_string(refused) + " refused, of " +
             std::to_string(record.rowsExpected())});
  }
  if (record.rowsExpired != 0) {
    warnings.push_back(
        {"rows_expired", "Rows of the spool expired: " + std::to_string(record.rowsExpired) +
                             " stood there for longer than TESSEL_SPOOL_DAYS"});
  }
  if (!record.setAside.empty())
    warnings.push_back(
        {"spool_damaged", "A damaged spool was set aside: " + joined(record.setAside)});
}

std::string example(const Loss& loss) {
  const std::string where = loss.where();
  return escaped(loss.words) + (where.empty() ? "" : " (" + escaped(where) + ")");
}

void addLosses(std::vector<RunWarning>& warnings, const Losses& losses) {
  for (const auto& row : kLossWarnings) {
    uint64_t count = 0;
    const Loss* first = nullptr;  // the list is sorted by code
    for (const Loss& loss : losses.all()) {
      if (loss.code < row.first || loss.code > row.last) continue;
      count += loss.count;
      if (first == nullptr) first = &loss;
    }
    if (first == nullptr) continue;
    warnings.push_back({row.warning, std::string(row.beginning) + std::to_string(count) +
                                         "; the first: " + example(*first)});
  }
}

}  // namespace

std::vector<RunWarning> runWarnings(const RunRecord& record) {
  std::vector<RunWarning> warnings;
  addOutcome(warnings, record);
  addRows(warnings, record);
  if (record.reading) addLosses(warnings, record.reading->losses);
  return warnings;
}

void logRunWarnings(const RunRecord& record) {
  for (const RunWarning& warning : runWarnings(record)) platformLog().warning("%@", warning.text);
}

}  // namespace tessel
