// Damaged journals: only damaged entries are lost, no entry is read twice, and the reader neither
// hangs nor crashes.
//
// TESSEL_DAMAGE_ROUNDS=10000 makes the random damage as thorough as it is before a release.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/falloc.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <random>

#include "journal/JournalFormat.h"
#include "journal/JournalStore.h"
#include "journal/testing/JournalDamage.h"
#include "journal/testing/JournalOracle.h"
#include "journal/testing/JournalWriter.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using namespace journal_format;
using testing::JournalLayout;
using testing::JournalWriter;
using testing::put;
using testing::TemporaryDirectory;

constexpr size_t kArenaSizeAt = 96;  // we do not believe it

struct Outcome {
  std::vector<uint64_t> numbers;
  bool problemTold = false;
  bool refused = false;
};

// Reads a file to its end, and calls `meanwhile` after `pause` entries.
Outcome read(const std::string& path, size_t pause = SIZE_MAX,
             const std::function<void()>& meanwhile = {}) {
  testing::RecordingTokenizer tokenizer;
  StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  if (opened.index() == 1) return {{}, true, true};
  JournalStore& store = *std::get<0>(opened);
  Outcome outcome;
  while (store.entries().next()) {
    outcome.numbers.push_back(store.entries().entry().header.sequenceNumber);
    if (outcome.numbers.size() == pause) meanwhile();
  }
  const StoreReport report = store.report();
  outcome.problemTold = !report.files.at(0).problems.empty() || report.files.at(0).skipped;
  return outcome;
}

bool ascendingWithoutRepetition(const std::vector<uint64_t>& numbers) {
  return std::adjacent_find(numbers.begin(), numbers.end(), std::greater_equal<>()) ==
         numbers.end();
}

JournalWriter journalOf(size_t entries, JournalLayout layout = {}) {
  JournalWriter writer(layout);
  writer.addSome(entries);
  return writer;
}

class JournalDamageTest : public ::testing::TestWithParam<bool> {
 protected:
  JournalLayout layout() const { return {.compact = GetParam()}; }

  TemporaryDirectory directory_;
};

INSTANTIATE_TEST_SUITE_P(Layouts, JournalDamageTest, ::testing::Bool());

TEST_P(JournalDamageTest, FindsAllBehindADamagedChain) {
  constexpr size_t kEntries = 3000;
  const JournalWriter writer = journalOf(kEntries, layout());
  using Fault = std::function<void(std::string&, uint64_t array)>;
  const std::pair<const char*, Fault> faults[] = {
      {"header zeroed", [](auto& file, auto array) { file.replace(array, 24, 24, '\0'); }},
      {"linked to itself", [](auto& file, auto array) { put(file, array + kArrayNextAt, array); }},
      {"linked nowhere", [](auto& file, auto array) { put(file, array + kArrayNextAt, 0); }},
      {"linked beyond the file",
       [](auto& file, auto array) { put(file, array + kArrayNextAt, file.size() * 8); }},
      {"first offset zeroed", [](auto& file, auto array) { put(file, array + kArrayItemsAt, 0); }},
      {"offsets overwritten",
       [](auto& file, auto array) { file.replace(array + kArrayItemsAt, 16, 16, '\x18'); }},
      {"size too large",
       [](auto& file, auto array) { put(file, array + kObjectSizeAt, file.size()); }},
  };
  for (const auto& [name, fault] : faults) {
    for (const uint64_t array : writer.arrays()) {
      // Nobody follows the link of the last array.
      if (array == writer.arrays().back() && std::string(name).starts_with("linked")) continue;
      std::string file = writer.bytes();
      fault(file, array);
      const Outcome outcome = read(directory_.write("a.journal", file));
      EXPECT_EQ(outcome.numbers.size(), kEntries) << name << " " << array;
      EXPECT_TRUE(ascendingWithoutRepetition(outcome.numbers)) << name;
      EXPECT_TRUE(outcome.problemTold) << name;
    }
  }
}

TEST_P(JournalDamageTest, FindsAllBehindADamagedHeader) {
  const JournalWriter writer = journalOf(1000, layout());
  for (const uint64_t wrong : {uint64_t{0}, uint64_t{7}, uint64_t{1} << 40, UINT64_MAX}) {
    for (const size_t at :
         {kHeaderSizeAt, kArenaSizeAt, kTailObjectAt, kEntryCountAt, kEntryArrayAt}) {
      std::string file = writer.bytes();
      put(file, at, wrong);
      const Outcome outcome = read(directory_.write("a.journal", file));
      EXPECT_EQ(outcome.numbers.size(), 1000u) << at << " " << wrong;
      EXPECT_TRUE(ascendingWithoutRepetition(outcome.numbers));
    }
  }
}

TEST_P(JournalDamageTest, LosesOnlyDamagedEntries) {
  const JournalWriter writer = journalOf(1000, layout());
  std::string file = writer.bytes();
  for (const size_t index : {size_t{0}, size_t{1}, size_t{500}, size_t{999}})
    put(file, writer.entries()[index] + kObjectSizeAt, 1);
  put(file, writer.entries()[600] + kEntrySequenceAt, UINT64_MAX - 1);
  const Outcome outcome = read(directory_.write("a.journal", file));
  EXPECT_EQ(outcome.numbers.size(), 995u);
  EXPECT_TRUE(ascendingWithoutRepetition(outcome.numbers));
  EXPECT_TRUE(outcome.problemTold);
}

// Every 16 bytes there could be an object. By its size each ends far away, in zeros that do not
// reach the end of the file. If the search looked through these zeros for each object, the test
// would time out.
TEST_P(JournalDamageTest, SearchTakesTimeOfTheFilesSize) {
  constexpr size_t kHalf = size_t{4} << 20;
  std::string file = journalOf(0, layout()).bytes();
  const size_t start = file.size();
  file.resize(start + 2 * kHalf);
  put(file, kEntryCountAt, 1);
  put(file, kArenaSizeAt, UINT64_MAX);
  for (size_t at = start; at < start + kHalf; at += 16) {
    file[at] = kData;
    put(file, at + kObjectSizeAt, start + kHalf - at + at % 8000);
  }
  file.back() = 1;
  EXPECT_TRUE(read(directory_.write("a.journal", file)).problemTold);
}

TEST_P(JournalDamageTest, KeepsWhatLiesBeforeACut) {
  const JournalWriter writer = journalOf(2000, layout());
  const std::string file = writer.bytes();
  for (const size_t cut : {size_t{1}, size_t{100}, size_t{16} << 10, file.size() / 2}) {
    const size_t left = file.size() - cut;
    const auto kept = static_cast<size_t>(
        std::lower_bound(writer.entries().begin(), writer.entries().end(), left) -
        writer.entries().begin());
    const Outcome outcome = read(directory_.write("a.journal", file.substr(0, left)));
    EXPECT_GE(outcome.numbers.size(), kept - 1) << cut;
    EXPECT_TRUE(outcome.problemTold) << cut;
    EXPECT_TRUE(ascendingWithoutRepetition(outcome.numbers)) << cut;
  }
}

TEST_P(JournalDamageTest, SurvivesRandomDamage) {
  const char* wanted = std::getenv("TESSEL_DAMAGE_ROUNDS");
  const uint64_t rounds = wanted != nullptr ? std::strtoull(wanted, nullptr, 10) : 300;
  constexpr size_t kEntries = 300;
  JournalLayout withText = layout();
  withText.compressFrom = 40;
  withText.sealEvery = 50;
  for (uint64_t seed = 0; seed < rounds; ++seed) {
    constexpr uint8_t kCompressions[] = {0, kXz, kLz4, kZstd};
    withText.compression = kCompressions[seed % 4];
    const std::string file = journalOf(kEntries, withText).bytes();
    const Outcome outcome = read(directory_.write("a.journal", testing::damaged(file, seed)));
    // Damage can double eight stretches of 600 bytes at most, which adds a few entries.
    EXPECT_LE(outcome.numbers.size(), kEntries + 50) << seed;
  }
}

// Others change the file while it is read. Each change happens at a hundred places.
class JournalMeanwhileTest : public ::testing::Test {
 protected:
  static constexpr size_t kEntries = 2000;
  static constexpr size_t kTimes = 100;

  std::vector<Outcome> readWith(const std::function<void(size_t time)>& meanwhile) {
    std::vector<Outcome> outcomes;
    for (size_t time = 0; time < kTimes; ++time) {
      directory_.write("a.journal", file_);
      outcomes.push_back(read(path_, 1 + time * kEntries / kTimes, [&] { meanwhile(time); }));
      EXPECT_TRUE(ascendingWithoutRepetition(outcomes.back().numbers)) << time;
    }
    return outcomes;
  }

  const JournalWriter writer_ = journalOf(kEntries);
  const std::string file_ = writer_.bytes();
  TemporaryDirectory directory_;
  const std::string path_ = directory_.path("a.journal");
};

TEST_F(JournalMeanwhileTest, RemovedOrRenamedIsReadWhole) {
  const auto rename = [&](size_t) { std::filesystem::rename(path_, directory_.path("b.journal")); };
  const auto remove = [&](size_t) { std::filesystem::remove(path_); };
  for (const Outcome& outcome : readWith(rename)) EXPECT_EQ(outcome.numbers.size(), kEntries);
  for (const Outcome& outcome : readWith(remove)) EXPECT_EQ(outcome.numbers.size(), kEntries);
}

TEST_F(JournalMeanwhileTest, ReportsWhatACutLoses) {
  std::mt19937 random(1);
  std::vector<size_t> sizes;
  const auto outcomes = readWith([&](size_t) {
    sizes.push_back(random() % file_.size());
    std::filesystem::resize_file(path_, sizes.back());
  });
  for (size_t i = 0; i < outcomes.size(); ++i) {
    const auto before = static_cast<size_t>(
        std::lower_bound(writer_.entries().begin(), writer_.entries().end(), sizes[i]) -
        writer_.entries().begin());
    EXPECT_GE(outcomes[i].numbers.size() + 1, before) << i;
    EXPECT_TRUE(outcomes[i].problemTold || outcomes[i].numbers.size() == kEntries) << i;
  }
}

TEST_F(JournalMeanwhileTest, ClosingAFileIsNoLoss) {
  for (const uint8_t state : {kOnline, kArchived}) {
    std::string file = journalOf(kEntries, {.state = state}).bytes();
    const size_t used = file.size();
    file.resize(used + (size_t{1} << 20));
    put(file, kArenaSizeAt, file.size() - 256);
    directory_.write("a.journal", file);
    const Outcome outcome = read(path_, 1, [&] { std::filesystem::resize_file(path_, used); });
    EXPECT_EQ(outcome.numbers.size(), kEntries);
    EXPECT_FALSE(outcome.problemTold);
  }
}

TEST_F(JournalMeanwhileTest, ReportsWhatAHoleLoses) {
  constexpr size_t kHole = 64 << 10;
  std::mt19937 random(1);
  std::vector<size_t> holes;
  const auto outcomes = readWith([&](size_t) {
    holes.push_back(4096 + random() % (file_.size() - kHole - 4096));
    const int fd = ::open(path_.c_str(), O_WRONLY | O_CLOEXEC);
    ASSERT_EQ(::fallocate(fd, FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE,
                          static_cast<off_t>(holes.back()), kHole),
              0);
    ::close(fd);
  });
  for (size_t i = 0; i < outcomes.size(); ++i) {
    const auto lost = std::count_if(
        writer_.entries().begin(), writer_.entries().end(),
        [&](uint64_t entry) { return entry + 128 > holes[i] && entry < holes[i] + kHole; });
    EXPECT_GE(outcomes[i].numbers.size() + static_cast<size_t>(lost) + 1, kEntries) << i;
    EXPECT_TRUE(outcomes[i].problemTold || outcomes[i].numbers.size() == kEntries) << i;
  }
}

}  // namespace
}  // namespace tessel
