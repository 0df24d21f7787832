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
#include <chrono>
#include <cstdlib>
#include <cstring>
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
  std::string problem = {};  // the first one's words
  bool refused = false;
};

// Reads a file to its end, and calls `meanwhile` after `pause` entries.
Outcome read(const std::string& path, size_t pause = SIZE_MAX,
             const std::function<void()>& meanwhile = {}) {
  testing::RecordingTokenizer tokenizer;
  StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  if (opened.index() == 1) return {{}, true, {}, true};
  JournalStore& store = *std::get<0>(opened);
  Outcome outcome;
  while (store.entries().next()) {
    outcome.numbers.push_back(store.entries().entry().header.sequenceNumber);
    if (outcome.numbers.size() == pause) meanwhile();
  }
  const StoreReport report = store.report();
  outcome.problemTold = !report.files.at(0).problems.empty() || report.files.at(0).skipped;
  const Losses& problems = report.files.at(0).problems;
  if (!problems.empty()) outcome.problem = problems.all()[0].words;
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
      {"linked to a later one",
       [&](auto& file, auto array) {
         put(file, array + kArrayNextAt, writer.arrays()[writer.arrays().size() - 1]);
       }},
      {"first offset is that of the last entry",
       [&](auto& file, auto array) {
         const uint64_t last = writer.entries().back();
         std::memcpy(file.data() + array + kArrayItemsAt, &last, layout().compact ? 4 : 8);
       }},
  };
  for (const auto& [name, fault] : faults) {
    for (const uint64_t array : writer.arrays()) {
      // Nobody follows the link of the last array.
      const size_t behind = std::string(name).ends_with("later one") ? 2 : 1;
      if (array >= writer.arrays()[writer.arrays().size() - behind] &&
          std::string(name).starts_with("linked"))
        continue;
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

// Each of these files let the reader read the same bytes again and again.
TEST_P(JournalDamageTest, ReadsFilesMadeToTakeLongInTime) {
  constexpr size_t kSize = size_t{4} << 20;
  const auto begin = std::chrono::steady_clock::now();
  // Entries that overlap, each with 2,000 fields.
  std::string file = journalOf(1, layout()).bytes();
  const size_t item = layout().compact ? kCompactEntryItemSize : kEntryItemSize;
  const std::string entry = file.substr(journalOf(1, layout()).entries()[0], kEntryItemsAt);
  const uint64_t first = file.size();
  std::string list(kArrayItemsAt, '\0');
  for (size_t i = 0; i < kSize / kEntryItemsAt; ++i) {
    file += entry;
    put(file, file.size() - kEntryItemsAt + kObjectSizeAt, kEntryItemsAt + 2000 * item);
    put(file, file.size() - kEntryItemsAt + kEntrySequenceAt, i + 2);
    const uint64_t offset = first + i * kEntryItemsAt;
    list.append(reinterpret_cast<const char*>(&offset), layout().compact ? 4 : 8);
  }
  list[0] = kEntryArray;
  put(list, kObjectSizeAt, list.size());
  put(file, kEntryArrayAt, file.size());
  put(file, kEntryCountAt, kSize / kEntryItemsAt);
  EXPECT_TRUE(read(directory_.write("a.journal", file + list)).problemTold);
  // Values that share one payload of frames which the decoder has to skip.
  file = journalOf(0, layout()).bytes();
  const uint64_t values = file.size();
  std::string fields;
  for (uint64_t i = 0; i < 2000; ++i) {
    const uint64_t head[] = {kData | kZstd << 8, kSize - i * 72, 0, 0, 0, 0, 0, 1, 0};
    file.append(reinterpret_cast<const char*>(head), sizeof head);
    const uint64_t field[] = {values + i * 72, 0};
    fields.append(reinterpret_cast<const char*>(field), layout().compact ? 4 : 16);
  }
  while (file.size() < values + kSize) file += std::string("\x50\x2a\x4d\x18\0\0\0\0", 8);
  const uint64_t at = file.size();
  file += entry + fields;
  put(file, at + kObjectSizeAt, kEntryItemsAt + fields.size());
  file.resize(alignUp(file.size()));
  put(file, kEntryArrayAt, file.size());
  const uint64_t array[] = {kEntryArray, kArrayItemsAt + sizeof at, 0, at};
  file.append(reinterpret_cast<const char*>(array), sizeof array);
  put(file, kEntryCountAt, 1);
  EXPECT_TRUE(read(directory_.write("a.journal", file)).problemTold);
  const std::chrono::duration<double> took = std::chrono::steady_clock::now() - begin;
  EXPECT_LT(took.count(), 4.0) << "the reader used to take more than a minute";
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

// The daemon first removes a file and then frees its blocks.
TEST_F(JournalMeanwhileTest, TellsRemovalFromDamage) {
  for (const Outcome& outcome : readWith([&](size_t) {
         const int fd = ::open(path_.c_str(), O_WRONLY | O_CLOEXEC);
         std::filesystem::remove(path_);
         ASSERT_EQ(::ftruncate(fd, 0), 0);
         ::close(fd);
       })) {
    if (outcome.numbers.size() == kEntries) continue;
    EXPECT_EQ(outcome.problem, "the file was removed while it was read");
  }
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
