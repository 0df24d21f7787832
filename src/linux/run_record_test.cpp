// The run record on disk.

#include "linux/RunRecordFile.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <set>

#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

// Each kind of loss.
StoreReading lossyDay() {
  StoreReading reading{1000, 11, 1'795'000'000'000'000, 1'794'000'000'000'000, 1, 4, 3, 1, {}, {}};
  for (size_t code = 0; code < kLossCodes; ++code)
    reading.losses.add(static_cast<LossCode>(code), "words", {}, code + 1);
  reading.losses.add(LossCode::fileDamaged, "entry damaged", {"/j/a.journal", 123}, 7);
  reading.losses.add(LossCode::fileDamaged, "entry damaged", {"/j/b.journal", 9});
  for (const uint32_t user : {0u, 1000u})
    reading.losses.add(LossCode::beyondPairLimit, "words", {"/opt/a", {}, user});
  reading.stopped = true;
  reading.rangeEnd = 1'795'000'000'000'001;
  reading.lastEntry = 1'795'000'000'000'000;
  return reading;
}

// As many losses as there may be, of texts that take the most room as JSON.
StoreReading hugeDay() {
  // The texts are cut in the middle of a character, unless that is looked at.
  std::string accents = "x";
  for (int i = 0; i < 2048; ++i) accents += "\xc3\xa9";
  const std::string texts[] = {std::string(4096, '\x01'), std::string(4096, '"'), accents};
  StoreReading reading = lossyDay();
  for (size_t i = 0; i < 300; ++i) {
    const std::string text = std::to_string(i) + texts[i % std::size(texts)];
    for (const LossCode code :
         {LossCode::fileSkipped, LossCode::fileDamaged, LossCode::droppedByDaemon}) {
      reading.losses.add({code, UINT64_MAX, text, {text, UINT64_MAX}, UINT64_MAX});
    }
    for (size_t code = 0; code < kLossCodes; ++code) {
      if (!isOverShare(static_cast<LossCode>(code))) continue;
      reading.losses.add(
          {static_cast<LossCode>(code), UINT64_MAX, "words", {text, {}, UINT32_MAX}});
    }
  }
  return reading;
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
  record.unsendable = 1;
  record.countEvents = 7;
  record.rowsStored = 9;
  record.rowsExpired = 12;
  record.rowsFailed = {{"locked", 1}, {"disk_full", 2}, {"limit", 0}};
  record.addTotals({5, {{"locked", 7}, {"read_only", 3}}});
  EXPECT_EQ(record.totals, (RowTotals{17, {{"disk_full", 2}, {"locked", 8}, {"read_only", 3}}}));
  record.expiredSince = 4;
  record.interval = std::chrono::seconds{86'400};
  record.setAside = {"statora.db.damaged-20261118T110640Z"};
  record.marker = "removed";
  record.logEvents = 18'446'744'073'709'551'615u;
  record.reading = lossyDay();
  return record;
}

TEST(RunRecordTest, ReadsBackWhatWasWritten) {
  const TemporaryDirectory directory;
  EXPECT_EQ(readRunRecord(directory.path()), std::nullopt);
  ASSERT_FALSE(writeRunRecord(RunRecord{}, directory.path()));
  ASSERT_FALSE(writeRunRecord(mixedDay(), directory.path()));
  EXPECT_EQ(readRunRecord(directory.path()), mixedDay());
  EXPECT_TRUE(writeRunRecord(mixedDay(), directory.path("missing")).has_value());
}

TEST(RunRecordTest, ABeginStaysWithoutEndIfNoneFollows) {
  const TemporaryDirectory directory{testing::memoryDirectory()};
  const auto runs = [&] { return std::get<RunHistory>(readRunHistory(directory.path())).runs; };
  RunRecord record = mixedDay();
  ASSERT_FALSE(writeRunBegin(record.start, directory.path("none"), directory.path()));
  EXPECT_FALSE(readRunRecord(directory.path())) << "no run has come to its end";
  EXPECT_FALSE(runs().at(0).end || runs().at(0).outcome || runs().at(0).taskingWritten);
  EXPECT_FALSE(runs().at(0).boot.empty());
  const RunNote dead = runs().at(0);
  for (size_t at = 1; at <= RunHistory::kMaxRuns; ++at) {
    record.start += std::chrono::hours{24};
    ASSERT_FALSE(writeRunBegin(record.start, directory.path(), directory.path()));
    EXPECT_EQ(runs().size() == RunHistory::kMaxRuns && runs().at(0) != dead,
              at == RunHistory::kMaxRuns);
    ASSERT_FALSE(writeRunRecord(record, directory.path()));
    EXPECT_EQ(runs().back().end, record.end);
    EXPECT_EQ(runs().back().outcome, record.outcome);
    EXPECT_TRUE(runs().back().taskingWritten);
  }
  EXPECT_EQ(readRunRecord(directory.path()), record);
}

TEST(RunRecordTest, ARecordThatIsNotWholeIsNone) {
  const TemporaryDirectory directory;
  for (const char* text :
       {"", "{", "[]", "{\"start\":\"soon\"}", "{\"start\":1,\"end\":2,\"outcome\":\"lost\"}"}) {
    directory.write("last_run.json", text);
    EXPECT_EQ(readRunRecord(directory.path()), std::nullopt) << text;
  }
}

TEST(RunRecordTest, OneWithADamagedReadingIsNone) {
  const TemporaryDirectory directory;
  ASSERT_FALSE(writeRunRecord(mixedDay(), directory.path()));
  const auto whole = nlohmann::json::parse(directory.read("last_run.json"));
  const std::set<std::string> optional{"oldest", "last_entry", "range_end", "stopped",
                                       "missing_numbers"};
  for (const auto& [member, value] : whole.at("reading").items()) {
    auto damaged = whole;
    damaged["reading"][member] = "text";
    directory.write("last_run.json", damaged.dump());
    EXPECT_EQ(readRunRecord(directory.path()), std::nullopt) << "with a text as " << member;
    damaged["reading"].erase(member);
    directory.write("last_run.json", damaged.dump());
    EXPECT_EQ(readRunRecord(directory.path()).has_value(), optional.contains(member)) << member;
  }
  auto unknown = whole;
  unknown["reading"]["losses"][0]["code"] = "mislaid";
  directory.write("last_run.json", unknown.dump());
  EXPECT_EQ(readRunRecord(directory.path()), std::nullopt);
}

TEST(RunRecordTest, OneOfAnOlderServiceHasNoReading) {
  const TemporaryDirectory directory;
  directory.write("last_run.json", R"({"start":1,"end":2,"outcome":"completed","failure":"",
    "log_events":3,"inspected":21,"classified":[1,2,3,4,5,6],"unnamed":0,"count_events":1,
    "rows_stored":6,"rows_failed":{"locked":0},"set_aside":[],
    "store":{"files":1,"files_skipped":0,"malformed":1},
    "reading":{"malformed":{"missing TESSEL_KIND":1},"intervals":{"dropped":0},
      "beyond_pair_limit":0,"without_exe":0,"store":{"range_start":1,"dropped":[]},"files":[]},
    "marker":"removed"})");
  const auto record = readRunRecord(directory.path());
  ASSERT_TRUE(record);
  EXPECT_FALSE(record->reading);
  const RunNote note{record->start, record->end, RunOutcome::completed, {}, {}, {}, record->sums()};
  EXPECT_EQ(std::get<RunHistory>(readRunHistory(directory.path())).runs, std::vector{note});
  EXPECT_TRUE(record->objectsBalance() && record->rowsBalance());
}

TEST(RunRecordTest, ItStaysSmallAndItsSumsStayWhole) {
  const TemporaryDirectory directory{testing::memoryDirectory()};
  RunRecord record = mixedDay();
  record.failure = std::string(4096, '\x01');
  record.reading = hugeDay();
  for (size_t at = 0; at < RunHistory::kMaxRuns; ++at) {
    RunRecord small = mixedDay();
    small.start += std::chrono::hours{at};
    small.outcome = RunOutcome::bailedOut;
    small.inspected = small.rowsStored = small.rowsFailed.at(0).second = UINT64_MAX / 2;
    ASSERT_FALSE(writeRunBegin(small.start, directory.path(), directory.path()));
    ASSERT_FALSE(writeRunRecord(small, directory.path()));
  }
  ASSERT_FALSE(writeRunRecord(record, directory.path()));
  EXPECT_LT(std::filesystem::file_size(directory.path("last_run.json")), size_t{1} << 18);
  const auto reread = readRunRecord(directory.path());
  ASSERT_TRUE(reread && reread->reading);
  ASSERT_EQ(reread->reading->losses.all().size(), record.reading->losses.all().size());
  for (size_t at = 0; at < kLossCodes; ++at) {
    const auto code = static_cast<LossCode>(at);
    EXPECT_EQ(reread->reading->losses.sum(code), record.reading->losses.sum(code));
  }
}

TEST(RunRecordTest, BooksBalanceWhereAllIsAccountedFor) {
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
