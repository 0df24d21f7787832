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
#include <array>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <random>

#include "journal/Decompressor.h"
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

// A wrong time moves an entry out of the range.
TEST_P(JournalDamageTest, TellsOfEachWrongTime) {
  constexpr uint64_t kHour = 3'600'000'000;
  for (const uint8_t state : {kArchived, kOnline}) {
    const JournalWriter writer = journalOf(100, {.compact = GetParam(), .state = state});
    const std::vector<uint64_t>& entries = writer.entries();
    for (const uint64_t at : {entries[0] + kEntryRealtimeAt, entries[50] + kEntryRealtimeAt,
                              entries[50] + kEntryMonotonicAt, entries[50] + kEntryBootAt,
                              entries[99] + kEntryRealtimeAt, entries[99] + kEntryMonotonicAt}) {
      std::string file = writer.bytes();
      put(file, at, load<uint64_t>(reinterpret_cast<const uint8_t*>(file.data()) + at) + kHour);
      EXPECT_TRUE(read(directory_.write("a.journal", file)).problemTold) << int{state} << " " << at;
    }
  }
}

// A journal of entries that name one value in each of their 2,000 items and do not match their
// hash.
std::string journalOfOneValue(JournalLayout layout, uint8_t compression, const std::string& payload,
                              size_t entries) {
  constexpr size_t kItems = 2000;
  JournalWriter writer(layout);
  std::vector<std::string> others;
  for (size_t i = 0; i < kItems; ++i) others.push_back("A=" + std::to_string(i));
  for (uint64_t i = 1; i <= entries; ++i) writer.add({.realtime = i}, others);
  std::string file = writer.bytes();
  const uint64_t value = file.size();
  for (const uint64_t entry : writer.entries())
    for (size_t item = 0; item < kItems; ++item)
      std::memcpy(file.data() + entry + kEntryItemsAt + item * (layout.compact ? 4 : 16), &value,
                  layout.compact ? 4 : 8);
  std::string head(layout.compact ? kCompactDataHeaderSize : kDataHeaderSize, '\0');
  head[0] = kData;
  head[1] = static_cast<char>(compression);
  put(head, kObjectSizeAt, head.size() + payload.size());
  return file + head + payload;
}

// Entries of 2,000 items, each of which begins in the one before.
std::string journalOfOverlappingEntries(JournalLayout layout) {
  JournalWriter writer(layout);
  writer.add({.realtime = 1}, {"MESSAGE=a"});
  std::string file = writer.bytes();
  std::string entry = file.substr(writer.entries()[0], kEntryItemsAt);
  put(entry, kObjectSizeAt, kEntryItemsAt + 2000 * (layout.compact ? 4 : 16));
  std::string list(kArrayItemsAt, '\0');
  for (uint64_t i = 2; i < 20'000; ++i, file += entry) {
    put(entry, kEntrySequenceAt, i);
    const uint64_t offset = file.size();
    list.append(reinterpret_cast<const char*>(&offset), layout.compact ? 4 : 8);
  }
  list[0] = kEntryArray;
  put(list, kObjectSizeAt, list.size());
  put(file, kEntryArrayAt, file.size());
  return file + list;
}

// Bytes that this thread has read from files.
uint64_t bytesRead() {
  std::ifstream counts("/proc/thread-self/io");
  std::string name;
  uint64_t bytes = 0;
  counts >> name >> bytes;
  return bytes;
}

// Each of these files leads to the same bytes again and again: gigabytes, if they were all read.
TEST_P(JournalDamageTest, ReadsFilesMadeToTakeLongAFewTimesOver) {
  // The beginning of a frame of ZSTD. Zeros are blocks in which nothing is.
  const std::string frame("\x28\xb5\x2f\xfd\0\x58", 6);
  for (const std::string& file :
       {journalOfOneValue(layout(), 0, "MESSAGE=" + std::string(60'000, 'x'), 20),
        journalOfOneValue(layout(), kZstd, frame + std::string(1 << 20, '\0'), 1),
        journalOfOverlappingEntries(layout())}) {
    const std::string path = directory_.write("a.journal", file);
    const uint64_t before = bytesRead();
    EXPECT_TRUE(read(path).problemTold);
    EXPECT_LT(bytesRead() - before, 100'000'000 + 210 * file.size()) << file.size();
  }
}

// 2^23 is 8 MiB. A reader that takes less loses values that other tools can read.
TEST(DecompressorTest, TakesWindowsOfEightMebibytes) {
  Decompressor decompressor;
  std::array<uint8_t, 64> text{};
  for (const int log : {10, 23, 24}) {
    std::string frame("\x28\xb5\x2f\xfd\0\0\x19\0\0abc", 12);  // one block of three bytes
    frame[5] = static_cast<char>((log - 10) << 3);
    const auto result = decompressor.decompress(
        kZstd,
        [&](uint64_t position, std::span<uint8_t> target) {
          return frame.copy(reinterpret_cast<char*>(target.data()), target.size(), position);
        },
        text);
    EXPECT_EQ(result ? result->produced : 0, log <= 23 ? 3u : 0u) << log;
  }
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
