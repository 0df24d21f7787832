// One wrong word in a journal: no trace point is missing or changed without a word, and no more
// than one entry is lost. Several wrong words: no crash, and no end of the reading.
//
// Two readers are compared with the truth: one that looks at trace points alone, and one that looks
// at every entry. TESSEL_DAMAGE_ROUNDS=10000 tries so many bends of each kind of file.

#include <gtest/gtest.h>

#include <map>
#include <random>

#include "journal/JournalStore.h"
#include "journal/testing/JournalBender.h"
#include "journal/testing/JournalOracle.h"
#include "journal/testing/JournalWriter.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::JournalLayout;
using testing::JournalWriter;

constexpr size_t kJournalEntries = 121;

// Every third entry is a trace point, the first and the last among them. Every fifteenth tells of
// loss.
JournalWriter journalWith(JournalLayout layout) {
  JournalWriter writer(layout);
  for (size_t i = 1; i <= kJournalEntries; ++i) {
    EntryHeader header;
    header.bootId = {1};
    header.monotonic = i * 1000;
    header.realtime = 1'795'300'000'000'000 + i * 1000;
    const std::string number = std::to_string(i);
    std::vector<std::string> fields = {"_HOSTNAME=desk", "MESSAGE=message " + number + " of some"};
    const auto add = [&](std::vector<std::string> more) {
      fields.insert(fields.end(), more.begin(), more.end());
    };
    if (i % 3 == 1) {
      add({i % 2 == 0 ? "TESSEL_KIND=event" : "TESSEL_KIND=begin", "TESSEL_SUBSYSTEM=com.vantor.a",
           "TESSEL_CATEGORY=Category", "TESSEL_TELEMETRY=" + std::to_string(i % 2),
           "TESSEL_NAME=Operation" + std::to_string(i % 7), "TESSEL_INTERVAL_ID=" + number});
    } else {
      add({"PRIORITY=" + std::to_string(i % 7), "_PID=" + std::to_string(i % 5)});
    }
    if (i % 15 == 2)
      add({"MESSAGE_ID=a596d6fe7bfa4994828e72309e95d61e", "_TRANSPORT=driver", "N_DROPPED=1"});
    writer.add(header, fields);
  }
  return writer;
}

struct Points {
  size_t entries = 0;
  std::map<std::string, size_t> texts;  // each trace point as it was read, and how often
  uint64_t dropped = 0;
  bool told = false;
};

Points pointsIn(const std::string& path, std::vector<std::string_view> marks) {
  testing::RecordingTokenizer tokenizer(std::move(marks));
  const StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  Points points;
  points.told = opened.index() == 1;
  if (points.told) return points;
  for (const auto& entry : testing::readAll(std::get<0>(opened)->entries(), tokenizer)) {
    ++points.entries;
    std::string text;
    for (const std::string& field : entry.fields)
      if (field.starts_with("TESSEL_")) text += field + " ";
    if (text.empty()) continue;
    // Nothing else in the file tells of the boot of the first and of the last entry, and of the
    // time since boot of the first. The clock may drift, so a minute more or less is not noticed.
    const bool first = text.find("_ID=1 ") != std::string::npos;
    const bool last = text.find("_ID=121 ") != std::string::npos;
    text += std::to_string(entry.header.realtime >> 26);
    if (!first) text += " " + std::to_string(entry.header.monotonic >> 26);
    if (!first && !last) text += " " + textOf(entry.header.bootId);
    ++points.texts[text];
  }
  const StoreReport report = std::get<0>(opened)->report();
  points.told = !report.files.at(0).problems.empty() || report.files.at(0).skipped;
  points.dropped = report.reading.losses.sum(LossCode::droppedByDaemon);
  return points;
}

class JournalMutationTest : public ::testing::TestWithParam<JournalLayout> {};

INSTANTIATE_TEST_SUITE_P(Layouts, JournalMutationTest, ::testing::ValuesIn(testing::everyLayout()));

TEST_P(JournalMutationTest, ChangesNothingWithoutAWord) {
  const uint64_t rounds = testing::damageRounds(150);
  const testing::TemporaryDirectory directory;
  const std::string good = journalWith(GetParam()).bytes();
  const std::string path = directory.write("a.journal", good);
  const Points truth = pointsIn(path, {"TESSEL_"});
  ASSERT_EQ(truth.texts.size(), kJournalEntries / 3 + 1);
  ASSERT_EQ(truth.dropped, kJournalEntries / 15);
  ASSERT_FALSE(truth.told);
  const testing::JournalBender bender(good, GetParam().compact);
  std::mt19937_64 random(1);
  for (uint64_t round = 0; round < rounds; ++round) {
    const auto [file, what] = bender.bent(random);
    directory.write("a.journal", file);
    for (const auto& marks : {std::vector<std::string_view>{"TESSEL_"}, {}}) {
      const Points points = pointsIn(path, marks);
      EXPECT_GE(points.entries + 1, kJournalEntries) << what << ": the word costs its own entry";
      EXPECT_TRUE(points.told || (points.texts == truth.texts && points.dropped == truth.dropped))
          << what << (marks.empty() ? ", without marks: " : ": ") << points.texts.size();
    }
  }
}

}  // namespace
}  // namespace tessel
