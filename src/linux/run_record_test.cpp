// The run record on disk.

#include "linux/RunRecord.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <nlohmann/json.hpp>

#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

FileReport fileOf(const std::string& path, std::optional<std::string> skipped = {}) {
  FileReport file;
  file.path = path;
  file.skipped = std::move(skipped);
  return file;
}

// Each kind of loss, and a file of each kind.
ExtractionReport lossyDay() {
  ExtractionReport report;
  report.entriesRead = 18'446'744'073'709'551'615u;
  report.assembly.malformed[static_cast<size_t>(MalformedReason::missingKind)] = 2;
  report.assembly.malformed[static_cast<size_t>(MalformedReason::valueTooLong)] = 3;
  report.assembly.withoutImagePath = 4;
  report.assembly.droppedOpenIntervals = 5;
  report.beyondPairLimit = 6;
  StoreReport& store = report.store;
  store.files = {fileOf("/j/well.journal"), fileOf("/j/old.journal", "outside the range"),
                 fileOf("/j/no.journal", "no journal file"), fileOf("/j/a.journal"),
                 fileOf("/j/b.journal")};
  store.files[1].outsideRange = true;
  store.files[3].addProblem("entry damaged", 123, 7);
  store.files[4].addProblem("entry damaged", 9, 1);
  store.files[4].addProblem("entries missing", 8, 2);
  store.entriesRead = 1000;
  store.duplicateEntries = 11;
  store.oldestEntry = 1'795'000'000'000'000;
  store.rangeStart = 1'794'000'000'000'000;
  store.sequenceGaps = 1;
  store.missingEntries = 12;
  store.dropped = {{"", 1}, {"vantor.service", 13}};
  store.filesNotLookedAt = 14;
  return report;
}

// As much as a store can say, of texts that take the most room as JSON.
ExtractionReport hugeDay() {
  const std::string control(4096, '\x01');
  const std::string quotes(4096, '"');
  ExtractionReport report = lossyDay();
  report.assembly.malformed.fill(UINT64_MAX);
  report.store.files.clear();
  for (int i = 0; i < 8192; ++i) {
    const std::string number = std::to_string(i);
    report.store.files.push_back(fileOf(i % 2 == 0 ? control : quotes, quotes + number));
    report.store.files.push_back(fileOf(quotes));
    report.store.files.back().addProblem(number + quotes, UINT64_MAX, 2);
    report.store.dropped.push_back({number + quotes, static_cast<uint64_t>(i)});
  }
  // Cut in the middle of two characters, unless that is looked at.
  std::string accents = "x";
  for (int i = 0; i < 2048; ++i) accents += "\xc3\xa9";
  report.store.dropped.push_back({accents, 8192});
  return report;
}

RunRecord mixedDay() {
  RunRecord record;
  record.start = Date{std::chrono::microseconds{1'795'000'000'000'001}};
  record.end = record.start + std::chrono::seconds{12};
  record.outcome = RunOutcome::interrupted;
  record.failure = "caf\xc3\xa9 \"x\"";
  record.inspected = 21;
  record.classified = {1, 2, 3, 4, 5, 6};
  record.unnamed = 1;
  record.countEvents = 7;
  record.rowsStored = 11;
  record.rowsFailed = {{"locked", 1}, {"disk_full", 2}};
  record.setAside = {"statora.db.damaged-20261118T110640Z"};
  record.marker = "removed";
  record.addReading(lossyDay());
  return record;
}

TEST(RunRecordTest, ReadsBackWhatWasWrittenAndReplacesTheOneBefore) {
  const TemporaryDirectory directory;
  EXPECT_EQ(RunRecord::read(directory.path()), std::nullopt);
  ASSERT_EQ(RunRecord{}.write(directory.path()), std::nullopt);
  ASSERT_EQ(mixedDay().write(directory.path()), std::nullopt);
  EXPECT_EQ(RunRecord::read(directory.path()), mixedDay());
  EXPECT_TRUE(mixedDay().write(directory.path("missing")).has_value());
}

TEST(RunRecordTest, ARecordThatIsNotWholeIsNone) {
  const TemporaryDirectory directory;
  for (const char* text :
       {"", "{", "[]", "{\"start\":\"soon\"}", "{\"start\":1,\"end\":2,\"outcome\":\"lost\"}"}) {
    directory.write("last_run.json", text);
    EXPECT_EQ(RunRecord::read(directory.path()), std::nullopt) << text;
  }
}

TEST(RunRecordTest, ARecordWithoutAReadingIsReadAndOneWithADamagedReadingIsNone) {
  const TemporaryDirectory directory;
  RunRecord without = mixedDay();
  without.reading.reset();
  ASSERT_EQ(without.write(directory.path()), std::nullopt);
  EXPECT_EQ(RunRecord::read(directory.path()), without);

  ASSERT_EQ(mixedDay().write(directory.path()), std::nullopt);
  const auto whole = nlohmann::json::parse(directory.read("last_run.json"));
  for (const auto& [member, value] : whole.at("reading").items()) {
    auto damaged = whole;
    damaged["reading"].erase(member);
    directory.write("last_run.json", damaged.dump());
    EXPECT_EQ(RunRecord::read(directory.path()), std::nullopt) << "without " << member;
    damaged["reading"][member] = "text";
    directory.write("last_run.json", damaged.dump());
    EXPECT_EQ(RunRecord::read(directory.path()), std::nullopt) << "with a text as " << member;
  }
}

TEST(RunRecordTest, TheReadingSumsProblemsByReasonAndTellsFilesApart) {
  RunRecord record;
  record.addReading(lossyDay());
  ASSERT_TRUE(record.reading);
  const ReadingDigest& reading = *record.reading;
  EXPECT_EQ(reading.filesRead, 3u);
  EXPECT_EQ(reading.filesOutsideRange, 1u);
  ASSERT_EQ(reading.store.files.size(), 1u);
  EXPECT_EQ(reading.store.files[0].path, "/j/no.journal");
  EXPECT_EQ(reading.problems,
            (std::vector<StoreProblem>{{"entry damaged", 8, 2, "/j/a.journal", 123},
                                       {"entries missing", 2, 1, "/j/b.journal", 8}}));
  EXPECT_EQ(reading.malformed, malformedCounts(lossyDay()));
  EXPECT_EQ(record.store, (RunRecord::Named{{"files", 5},
                                            {"files_skipped", 1},
                                            {"files_damaged", 2},
                                            {"entries_missing", 12},
                                            {"malformed", 5},
                                            {"open_intervals_dropped", 5},
                                            {"beyond_pair_limit", 6}}));
  RunRecord nothing;
  nothing.addReading({});
  EXPECT_FALSE(nothing.reading) << "a store that could not be opened";
}

TEST(RunRecordTest, ItStaysSmallWhateverTheStoreLooksLikeAndItsSumsStayWhole) {
  const TemporaryDirectory directory;
  RunRecord record = mixedDay();
  record.failure = std::string(4096, '\x01');
  record.addReading(hugeDay());
  ASSERT_EQ(record.write(directory.path()), std::nullopt);
  EXPECT_LT(std::filesystem::file_size(directory.path("last_run.json")), 65536u);

  const auto reread = RunRecord::read(directory.path());
  ASSERT_TRUE(reread && reread->reading);
  EXPECT_EQ(reread->reading, record.reading);
  const ReadingDigest& reading = *reread->reading;
  EXPECT_EQ(reading.store.files.size() + reading.filesNotListed, 8192u);
  ASSERT_EQ(reading.problems.size(), ReadingDigest::kMaxListed);
  EXPECT_EQ(reading.problems.back().reason, "other");
  uint64_t problems = 0;
  for (const StoreProblem& problem : reading.problems) problems += problem.count;
  EXPECT_EQ(problems, 2u * 8192u);
  uint64_t dropped = reading.droppedNotListed;
  for (const DroppedEntries& entries : reading.store.dropped) dropped += entries.count;
  EXPECT_EQ(dropped, 8192u * 8193u / 2 + 14);
  EXPECT_EQ(reading.store.dropped.front().count, 8192u) << "those that dropped most are listed";
}

TEST(RunRecordTest, BooksBalanceOnlyWhereEveryObjectAndEveryRowIsAccountedFor) {
  RunRecord record = mixedDay();
  EXPECT_TRUE(record.objectsBalance());
  EXPECT_TRUE(record.rowsBalance());
  ++record.inspected;
  --record.rowsStored;
  EXPECT_FALSE(record.objectsBalance());
  EXPECT_FALSE(record.rowsBalance());
}

}  // namespace
}  // namespace tessel
