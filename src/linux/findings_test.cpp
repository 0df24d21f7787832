// The warnings of a finished run.

#include "linux/Findings.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>

#include "linux/LogSinks.h"
#include "platform/Text.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

std::vector<std::string> codesOf(const RunRecord& record) {
  std::vector<std::string> codes;
  for (const Finding& found : findingsOf(record)) codes.emplace_back(findingName(found.code));
  return codes;
}

// Loses something for every reason, in texts from outside that are long and hostile.
RunRecord worstRun() {
  RunRecord record;
  record.outcome = RunOutcome::interrupted;
  record.marker = "still there";
  record.rowsExpired = 7;
  for (int reason = 0; reason < 300; ++reason)
    record.rowsFailed.emplace_back("reason\n" + std::to_string(reason) + std::string(4096, '\x1b'),
                                   1);
  record.setAside = std::vector<std::string>(300, std::string(4096, '\n'));
  record.reading.emplace();
  record.reading->stopped = true;
  record.reading->rangeEnd = 90'000'000;
  record.reading->lastEntry = 0;
  for (size_t code = 0; code < kLossCodes; ++code) {
    for (int writer = 0; writer < 300; ++writer) {
      record.reading->losses.add(static_cast<LossCode>(code), std::string(4096, '\x9b'),
                                 {"/writer\n" + std::to_string(writer), writer});
    }
  }
  return record;
}

TEST(FindingsTest, AGoodRunHasNone) {
  RunRecord record;
  record.rowsStored = record.rowsExpected();
  record.marker = "removed";
  record.rowsFailed = {{"locked", 0}};
  record.reading.emplace().losses.add(LossCode::noImagePath, "process gone", {}, 7);
  EXPECT_THAT(codesOf(record), ::testing::IsEmpty());
}

TEST(FindingsTest, EveryReasonIsOneBoundedLineWithAnId) {
  RunRecord record = worstRun();
  auto codes = codesOf(record);
  EXPECT_EQ(std::ranges::count(codes, "rows_refused"), 16);
  EXPECT_EQ(std::ranges::count(codes, "over_share"), 5) << "one for each reason, not each writer";
  EXPECT_EQ(findingsOf(record)[0].words,
            "The run was cut short: the last 2 minutes of its day were not read");
  codes.erase(std::unique(codes.begin(), codes.end()), codes.end());
  EXPECT_THAT(codes, ::testing::ElementsAre("run_cut_short", "marker_stuck", "rows_refused",
                                            "books_unbalanced", "rows_expired", "spool_set_aside",
                                            "store_unreadable", "store_damaged",
                                            "dropped_by_daemon", "numbers_in_no_file", "malformed",
                                            "lost_at_source", "over_share"));
  auto warnings = findingsOf(record);
  for (const RunOutcome outcome : {RunOutcome::failed, RunOutcome::bailedOut}) {
    record.outcome = outcome;
    record.failure = std::string(4096, '\n');
    warnings.push_back(findingsOf(record).front());
  }
  for (const Finding& found : warnings) {
    const std::string& text = found.words;
    EXPECT_LT(text.size(), 1024u) << text;
    EXPECT_EQ(text, plainText(text, "\\x0a"));
    EXPECT_THAT(journalFields(LogLevel::warning, "", "", text),
                ::testing::Contains(::testing::StartsWith("MESSAGE_ID=")))
        << text;
  }
}

TEST(FindingsTest, EveryLossOfTheDayIsOne) {
  for (size_t code = 0; code < kLossCodes; ++code) {
    RunRecord record;
    record.rowsStored = record.rowsExpected();
    record.reading.emplace().losses.add(static_cast<LossCode>(code), "words", {});
    const auto loss = static_cast<LossCode>(code);
    const bool isOne = loss != LossCode::noImagePath && loss != LossCode::lostEarlier;
    const size_t expected = isOne ? 1 : 0;
    EXPECT_EQ(findingsOf(record).size(), expected) << lossName(static_cast<LossCode>(code));
  }
}

TEST(FindingsTest, LossesOfACodeAreSummedUp) {
  RunRecord record;
  record.rowsStored = record.rowsExpected();
  Losses& losses = record.reading.emplace().losses;
  losses.add(LossCode::fileSkipped, "Permission denied", {"/j/a.journal", {}}, 2);
  losses.add(LossCode::fileSkipped, "Permission denied", {"/j/b.journal", {}});
  losses.add(LossCode::filesNotLookedAt, "too many files to look at", {}, 4);
  losses.add(LossCode::openIntervalDropped, "too many begins", {"/a", {}, 7}, 5);
  losses.add(LossCode::beyondTimeLimit, "too much time", {"/a", {}, 7}, 2);
  losses.add(LossCode::beyondTimeLimit, "too much time", {"/b", {}, 8});
  testing::RecordingLog log(LogLevel::error);
  logFindings(record);
  EXPECT_THAT(log.lines(),
              ::testing::ElementsAre("Files of the trace store were not read: 7; the first: "
                                     "Permission denied (/j/a.journal)",
                                     "Writers had more than their share, begins lost: 5; the "
                                     "first: too many begins (user 7, /a)",
                                     "Writers had more than their share, objects lost: 3; the "
                                     "first: too much time (user 7, /a)"));
}

}  // namespace
}  // namespace tessel
