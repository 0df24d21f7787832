// One wrong word in a journal: no verdict is missing or another without a word.
//
// TESSEL_DAMAGE_ROUNDS=10000 tries so many bends of each kind of file.

#include <gtest/gtest.h>

#include <map>
#include <random>

#include "journal/testing/JournalBender.h"
#include "journal/testing/JournalWriter.h"
#include "os/testing/TemporaryDirectory.h"
#include "tesselctl/judging/Judge.h"
#include "tesselctl/reading/DryRun.h"

namespace tessel::ctl {
namespace {

using tessel::testing::JournalLayout;
using tessel::testing::JournalWriter;

constexpr uint64_t kStart = 1'795'300'000'000'000;  // microseconds since 1970
constexpr uint64_t kSecond = 1'000'000;
constexpr size_t kRounds = 40;

// Each round has an event, the begin of an interval, the end of an earlier one of the same process,
// and log lines. Some have an unknown value, some are not marked for telemetry.
JournalWriter journalWith(JournalLayout layout) {
  JournalWriter writer(layout);
  uint64_t at = 0;
  const auto add = [&](std::vector<std::string> fields) {
    EntryHeader header;
    header.bootId = {1};
    header.monotonic = ++at * kSecond;
    header.realtime = kStart + at * kSecond;
    writer.add(header, fields);
  };
  add({"MESSAGE=the first line of this machine", "PRIORITY=6"});
  for (size_t i = 0; i < kRounds; ++i) {
    const auto point = [&](const std::string& kind, size_t number) {
      const std::string process = std::to_string(number % 5);
      add({"_HOSTNAME=desk", "MESSAGE=point " + std::to_string(i) + " of some", "_PID=" + process,
           "_UID=100" + process, "_EXE=/usr/bin/program" + process, "TESSEL_KIND=" + kind,
           "TESSEL_SUBSYSTEM=com.vantor.Calendar", "TESSEL_CATEGORY=View",
           "TESSEL_NAME=Operation" + std::to_string(number % 7),
           "TESSEL_TELEMETRY=" + std::to_string(number % 3 == 0 ? 0 : 1),
           "TESSEL_STRING1_NAME=period",
           number % 4 == 0 ? "TESSEL_STRING1_VALUE=weekly" : "TESSEL_STRING1_VALUE=week",
           "TESSEL_INTERVAL_ID=" + std::to_string(number)});
    };
    point("event", i);
    point("begin", i);
    if (i >= 9) point("end", i - 9);
    add({"_HOSTNAME=desk", "PRIORITY=" + std::to_string(i % 7), "MESSAGE=a line of the log"});
  }
  return writer;
}

struct Judged {
  std::map<std::string, size_t> verdicts;  // an object with its verdict, and how often
  bool told = false;
};

Judged judge(const std::string& path) {
  Judged judged;
  Judge service(JudgedMachine{});
  DryRun run(path, [&](const TesselObject& object, const EntryHeader&) {
    const FilterDecision decision = service.inspect(object);
    ++judged.verdicts[std::string(object.tesselType()) + " " +
                      std::string(object.name().textOr("no name")) + " " +
                      std::string(verdictName(decision.classification))];
    return true;
  });
  const Period day{Date{std::chrono::microseconds{kStart}},
                   Date{std::chrono::microseconds{kStart + 86'400 * kSecond}}};
  judged.told = run.read(day, {}).has_value();
  const ExtractionReport report = run.report();
  judged.told = judged.told || report.store.files.size() != 1 ||
                !report.store.files[0].problems.empty() || report.store.files[0].skipped;
  return judged;
}

class BentJournalTest : public ::testing::TestWithParam<JournalLayout> {};

INSTANTIATE_TEST_SUITE_P(Layouts, BentJournalTest,
                         ::testing::ValuesIn(tessel::testing::everyLayout()));

TEST_P(BentJournalTest, ChangesNoVerdictWithoutAWord) {
  const std::string good = journalWith(GetParam()).bytes();
  const tessel::testing::TemporaryDirectory directory;
  const std::string path = directory.write("a.journal", good);
  const Judged truth = judge(path);
  ASSERT_FALSE(truth.told);
  ASSERT_GE(truth.verdicts.size(), 20u);
  const tessel::testing::JournalBender bender(good, GetParam().compact);
  std::mt19937_64 random(1);
  const uint64_t rounds = tessel::testing::damageRounds(50);
  for (uint64_t round = 0; round < rounds; ++round) {
    const auto [file, what] = bender.bent(random);
    directory.write("a.journal", file);
    const Judged judged = judge(path);
    EXPECT_TRUE(judged.told || judged.verdicts == truth.verdicts) << what;
  }
}

}  // namespace
}  // namespace tessel::ctl
