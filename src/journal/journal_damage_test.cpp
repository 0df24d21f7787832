// Damaged journals: only damaged entries are lost, no entry is read twice, and the reader neither
// hangs nor crashes.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/falloc.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <random>

#include "journal/JournalFile.h"
#include "journal/JournalFormat.h"
#include "journal/JournalStore.h"
#include "journal/testing/JournalBender.h"
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
  uint64_t missing = 0;      // entries, as the report says
  std::string problem = {};  // the first one's words
  bool refused = false;
};

// Reads a file to its end, and calls `meanwhile` after `pause` entries.
Outcome read(const std::string& path, size_t pause = SIZE_MAX,
             const std::function<void()>& meanwhile = {}) {
  testing::RecordingTokenizer tokenizer({"MESSAGE="});
  StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  if (opened.index() == 1) return {{}, true, 0, {}, true};
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
  for (const Loss& loss : problems.all())
    if (loss.words == "entries missing") outcome.missing = loss.count;
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
  constexpr size_t kEntries = 1000;
  JournalWriter writer;
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
  for (size_t i = 0; i < 2 * std::size(faults); ++i) {
    const auto& [name, fault] = faults[i / 2];
    writer = journalOf(kEntries, {.compact = GetParam(), .state = i % 2 ? kOnline : kArchived});
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
  EXPECT_EQ(outcome.missing, 5u);
}

// A wrong time moves an entry out of the range, a wrong number to another place.
TEST_P(JournalDamageTest, TellsOfEachWrongTimeAndNumber) {
  constexpr uint64_t kHour = 3'600'000'000;
  for (const uint8_t state : {kArchived, kOnline}) {
    const JournalWriter writer = journalOf(100, {.compact = GetParam(), .state = state});
    const std::vector<uint64_t>& entries = writer.entries();
    for (const uint64_t at : {entries[0] + kEntryRealtimeAt, entries[50] + kEntryRealtimeAt,
                              entries[50] + kEntryMonotonicAt, entries[50] + kEntryBootAt,
                              entries[50] + kEntrySequenceAt, entries[99] + kEntryRealtimeAt,
                              entries[99] + kEntryMonotonicAt}) {
      std::string file = writer.bytes();
      put(file, at, load<uint64_t>(reinterpret_cast<const uint8_t*>(file.data()) + at) + kHour);
      EXPECT_TRUE(read(directory_.write("a.journal", file)).problemTold) << int{state} << " " << at;
    }
  }
}

// What a reader of entries with a MESSAGE finds in `file`.
struct Fields {
  std::vector<testing::PlainEntry> entries;
  std::vector<std::string> problems;
  size_t shown = 0;  // how often a text was
};

Fields fieldsIn(const std::string& path, bool newGenerations = false) {
  testing::RecordingTokenizer tokenizer({"MESSAGE="});
  tokenizer.newGenerations = newGenerations;
  const StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  Fields fields{testing::readAll(std::get<0>(opened)->entries(), tokenizer), {}, tokenizer.shown()};
  const StoreReport report = std::get<0>(opened)->report();
  for (const Loss& loss : report.files.at(0).problems.all()) fields.problems.push_back(loss.words);
  return fields;
}

TEST_P(JournalDamageTest, TellsOfEachFieldThatCannotBeRead) {
  JournalWriter writer({.compact = GetParam(), .keyed = GetParam()});
  writer.add({.monotonic = 1, .realtime = 1}, {"MESSAGE=one", "PRIORITY=1"});
  writer.add({.monotonic = 2, .realtime = 2}, {"MESSAGE=two", "PRIORITY=2"});
  const std::string loss = "MESSAGE_ID=a596d6fe7bfa4994828e72309e95d61e";
  writer.add({.monotonic = 3, .realtime = 3}, {loss, "N_DROPPED=3", "_TRANSPORT=driver"});
  const uint64_t text = writer.dataOf("MESSAGE=two");
  const size_t head = layout().compact ? kCompactDataHeaderSize : kDataHeaderSize;
  const std::pair<std::vector<std::string>, std::function<void(std::string&)>> faults[] = {
      {{"PRIORITY=2"}, [&](std::string& file) { file[text + head + 8] = 'T'; }},
      {{"PRIORITY=2"}, [&](std::string& file) { file[text + 1] = kZstd; }},
      {{"PRIORITY=2"},
       [&](std::string& file) {
         const auto noData = static_cast<uint32_t>(writer.entries()[0]);
         std::memcpy(&file[writer.entries()[1] + kEntryItemsAt], &noData, sizeof noData);
       }},
      {{}, [&](std::string& file) { put(file, writer.entries()[1] + kEntryHashAt, 1); }},
      {{"MESSAGE=two", "PRIORITY=2"},
       [&](std::string& file) { file[writer.dataOf(loss) + head + 20] = 'x'; }},
  };
  for (const auto& [left, fault] : faults) {
    std::string file = writer.bytes();
    fault(file);
    const Fields fields = fieldsIn(directory_.write("a.journal", file));
    ASSERT_EQ(fields.entries.size(), 3u);
    EXPECT_EQ(fields.entries[1].fields, left) << &left - &faults[0].first;
    EXPECT_THAT(fields.problems, ::testing::ElementsAre(::testing::EndsWith("damaged")));
  }
}

TEST_P(JournalDamageTest, TakesNoLongOrLargeEntryForDamaged) {
  const std::string text = "MESSAGE=" + std::string(70'000, 'x');
  for (const uint8_t compression : {uint8_t{0}, uint8_t{kZstd}}) {
    JournalWriter writer({.compact = GetParam(), .compression = compression});
    for (uint64_t i = 1; i <= 3; ++i) writer.add({.realtime = i}, {text, "PRIORITY=6"});
    const std::string path = directory_.write("a.journal", writer.bytes());
    for (const bool newGenerations : {false, true}) {
      const Fields fields = fieldsIn(path, newGenerations);
      ASSERT_EQ(fields.entries.size(), 3u);
      for (const auto& entry : fields.entries)
        EXPECT_THAT(entry.fields,
                    ::testing::ElementsAre(::testing::SizeIs(kMaxFieldHead + 3), "PRIORITY=6"));
      EXPECT_THAT(fields.problems, ::testing::IsEmpty());
      EXPECT_EQ(fields.shown, newGenerations ? 6u : 2u);
    }
  }
  JournalWriter writer(layout());
  std::vector<std::string> many;
  for (size_t i = 0; i <= JournalFile::kMaxItems; ++i)
    many.push_back("MESSAGE=" + std::to_string(i));
  writer.add({.realtime = 1}, many);
  const Fields fields = fieldsIn(directory_.write("a.journal", writer.bytes()));
  EXPECT_EQ(fields.entries.at(0).fields.size(), JournalFile::kMaxItems);
  EXPECT_THAT(fields.problems, ::testing::ElementsAre("entry with too many fields"));
}

TEST_P(JournalDamageTest, AStopIsNoDamage) {
  const std::string path = directory_.write("a.journal", journalOf(100, layout()).bytes());
  testing::RecordingTokenizer tokenizer;
  StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  ASSERT_TRUE(std::get<0>(opened)->entries().next());
  stop = true;
  EXPECT_FALSE(std::get<0>(opened)->entries().next());
  EXPECT_TRUE(std::get<0>(opened)->report().files.at(0).problems.empty());
}

// The daemon, or a daemon that was killed, has begun an entry and not listed it.
TEST_P(JournalDamageTest, AnUnfinishedEntryIsNoDamage) {
  const JournalWriter writer = journalOf(100, {.compact = GetParam(), .state = kOnline});
  std::string file = writer.bytes();
  put(file, kTailObjectAt, file.size());
  file += std::string(1, kEntry) + std::string(2047, '\0');
  const Outcome outcome = read(directory_.write("a.journal", file));
  EXPECT_EQ(outcome.numbers.size(), 100u);
  EXPECT_FALSE(outcome.problemTold);
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

// The daemon opens a user's file again for the next entry, and closes it.
TEST_F(JournalMeanwhileTest, AFileThatGrowsIsNoDamage) {
  const std::string longer = journalOf(kEntries + 100).bytes();
  for (const Outcome& outcome : readWith([&](size_t) {
         std::fstream file(path_, std::ios::in | std::ios::out | std::ios::binary);
         file << longer;
       })) {
    EXPECT_GE(outcome.numbers.size(), kEntries);
    EXPECT_FALSE(outcome.problemTold) << outcome.problem;
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
