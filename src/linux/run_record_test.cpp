// The run record on disk.

#include "linux/RunRecord.h"

#include <gtest/gtest.h>

#include "linux/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

RunRecord mixedDay() {
  RunRecord record;
  record.start = Date{std::chrono::microseconds{1'795'000'000'000'001}};
  record.end = record.start + std::chrono::seconds{12};
  record.outcome = RunOutcome::interrupted;
  record.failure = "caf\xc3\xa9 \"x\"";
  record.logEvents = 18'446'744'073'709'551'615u;
  record.inspected = 21;
  record.classified = {1, 2, 3, 4, 5, 6};
  record.unnamed = 1;
  record.countEvents = 7;
  record.rowsStored = 11;
  record.rowsFailed = {{"locked", 1}, {"disk_full", 2}};
  record.setAside = {"statora.db.damaged-20261118T110640Z"};
  record.store = {{"files", 3}, {"entries", 1000}};
  record.marker = "removed";
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
