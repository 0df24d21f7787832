// What programs tell of their own losses: counters told apart, periods, and writers who tell lies.

#include "trace/SourceLosses.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "trace/JournalExtractor.h"
#include "trace/testing/FakeEntryStream.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using testing::FakeEntry;
using testing::FakeEntryStream;
using testing::tracePoint;
using Lines = std::vector<std::string>;

class SourceLossesTest : public ::testing::Test {
 protected:
  static constexpr uint64_t kStart = 1'000'000;

  // An entry that is no trace point. `fields` begins with a '|', as in tracePoint().
  static FakeEntry last(const std::string& fields, uint8_t boot = 1) {
    FakeEntry entry = tracePoint("event" + fields, 0, boot);
    std::erase_if(entry.fields, [](const std::string& field) {
      return field.starts_with("TESSEL_KIND") || field.starts_with("TESSEL_SUB") ||
             field.starts_with("TESSEL_CAT");
    });
    return entry;
  }
  // The losses of the entries, each with its count.
  Lines losses(std::vector<FakeEntry> entries) {
    JournalExtractor extractor;
    extractor.startLossesAt(kStart);
    FakeEntryStream stream(extractor.tokenizer(), std::move(entries));
    extractor.processEntries(stream);
    const ExtractionReport report = extractor.report();
    tracePoints = report.assembly.tracePoints;
    Lines lines;
    for (const Loss& loss : report.store.reading.losses.all()) {
      if (loss.code == LossCode::lostAtSource || loss.code == LossCode::lostEarlier) {
        lines.push_back(std::to_string(loss.count) + " " + std::string(lossName(loss.code)) + " " +
                        loss.where());
      }
    }
    return lines;
  }

  uint64_t tracePoints = 0;
  const std::string since = "|LOST_SINCE=1000000";
};

TEST_F(SourceLossesTest, aTotalCountsOnceHoweverOftenItIsTold) {
  const std::string a = "|_EXE=/a|_UID=1|_PID=7" + since, b = "|_EXE=/b|_UID=2|_PID=8" + since;
  EXPECT_THAT(losses({tracePoint("event|LOST=2" + a), tracePoint("begin|LOST=5" + a),
                      tracePoint("event|LOST=3" + b), tracePoint("event|LOST=4" + a),
                      tracePoint("event|LOST=5" + a), last("|LOST=9|_UID=1|_PID=7" + since)}),
              ElementsAre("9 lost_at_source user 1, /a", "3 lost_at_source user 2, /b"))
      << "the last entry of a process is often read when its executable is unknown";
  EXPECT_EQ(tracePoints, 5u);
  EXPECT_THAT(losses({last("|LOST=300|_UID=1|_PID=7")}),
              ElementsAre("300 lost_at_source unknown user, unknown"));
  EXPECT_THAT(losses({tracePoint("nonsense|LOST=2" + a)}),
              ElementsAre("2 lost_at_source user 1, /a"))
      << "a malformed entry tells it as well";
}

TEST_F(SourceLossesTest, countersAreToldApart) {
  const std::string program = "|_EXE=/a|_UID=1|_PID=7";
  EXPECT_THAT(losses({last("|LOST=5" + program + "|LOST_SINCE=2000000"),
                      last("|LOST=3" + program + "|LOST_SINCE=3000000"),
                      last("|LOST=5" + program + "|LOST_SINCE=2000000", 2)}),
              ElementsAre("13 lost_at_source user 1, /a"))
      << "a library beside a program, or a number that is used again; another boot";
  EXPECT_THAT(
      losses({last("|LOST=5" + program), last("|LOST=6" + program), last("|LOST=2" + program),
              last("|LOST=4|_EXE=/b|_UID=1|_PID=7"), last("|LOST=7|_EXE=/a|_UID=2|_PID=7")}),
      ElementsAre("8 lost_at_source user 1, /a", "7 lost_at_source user 2, /a",
                  "4 lost_at_source user 1, /b"))
      << "without a time: a total that falls, or another writer, is another process";
}

TEST_F(SourceLossesTest, aProcessFromBeforeThePeriodCountsWithItsGrowth) {
  const std::string old = "|_EXE=/a|_UID=1|_PID=7|LOST_SINCE=999999";
  EXPECT_THAT(losses({last("|LOST=50" + old), last("|LOST=50" + old), last("|LOST=57" + old)}),
              ElementsAre("7 lost_at_source user 1, /a", "50 lost_earlier user 1, /a"));
  EXPECT_THAT(losses({last("|LOST=50" + old), last("|LOST=20|_EXE=/a|_UID=1|_PID=8" + since)}),
              ElementsAre("20 lost_at_source user 1, /a", "50 lost_earlier user 1, /a"));
}

TEST_F(SourceLossesTest, nonsenseCountsAsAbsentAndNoSumOverflows) {
  const std::string program = "|_EXE=/a|_UID=1|_PID=7" + since;
  for (const char* value : {"-1", "abc", "", "1e3", "0", "99999999999999999999999", "1.5"})
    EXPECT_THAT(losses({tracePoint("event|LOST=" + std::string(value) + program)}), ElementsAre());
  EXPECT_EQ(tracePoints, 1u);
  const std::string most = "|LOST=18446744073709551615|_EXE=/a|_UID=1|LOST_SINCE=";
  std::vector<FakeEntry> entries = {last("|LOST=2|LOST=3" + program)};
  EXPECT_THAT(losses(entries), ElementsAre("3 lost_at_source user 1, /a")) << "the greatest counts";
  for (int i = 0; i < 3; ++i) entries.push_back(last(most + std::to_string(2'000'000 + i)));
  EXPECT_THAT(losses(entries), ElementsAre(std::to_string(3 * SourceLosses::kMostOfACounter + 3) +
                                           " lost_at_source user 1, /a"));
}

// Without shares the liar's counters would fill the table, and the losses of all who come later
// would not be told apart. Without turns his programs would fill the list.
TEST_F(SourceLossesTest, aLiarDoesNotCrowdOutTheHonest) {
  std::vector<FakeEntry> entries;
  for (int i = 0; i < 40'000; ++i) {
    entries.push_back(last("|LOST=9|_EXE=/liar" + std::to_string(i % 20) +
                           "|_UID=1|_PID=7|LOST_SINCE=" + std::to_string(2'000'000 + i)));
  }
  for (int i = 0; i < 1'000; ++i) {
    const std::string process = "|_EXE=/honest|_UID=2|_PID=" + std::to_string(1'000 + i) + since;
    entries.push_back(last("|LOST=1" + process));
    entries.push_back(last("|LOST=3" + process));
  }
  const Lines lines = losses(std::move(entries));
  ASSERT_EQ(lines.size(), 17u);
  EXPECT_EQ(lines[1], "3000 lost_at_source user 2, /honest");
}

}  // namespace
}  // namespace tessel
