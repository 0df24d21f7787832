// Compares the entries that a reader shows by a file's index with those that the file holds.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <set>

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

constexpr size_t kJournalSize = 1000;
constexpr const char* kLoss = "MESSAGE_ID=a596d6fe7bfa4994828e72309e95d61e";

const std::vector<EntryMark> kMarks = {{"KIND", {}, {"SUBSYSTEM"}}};

using Numbers = std::set<uint64_t>;

void addEntry(JournalWriter& writer, std::vector<std::string> fields) {
  const uint64_t number = writer.entries().size() + 1;
  EntryHeader header;
  header.bootId = {1};
  header.monotonic = number * 1000;
  header.realtime = 1'795'300'000'000'000 + number * 1000;
  fields.push_back("MESSAGE=message " + std::to_string(number));
  writer.add(header, fields);
}

bool isMarked(uint64_t number) { return number % 5 == 0; }
bool tellsOfLoss(uint64_t number) { return number % 100 == 1; }

JournalWriter markedJournal(JournalLayout layout) {
  JournalWriter writer(layout);
  for (size_t i = 1; i <= kJournalSize; ++i) {
    if (isMarked(i)) {
      addEntry(writer, {i % 2 == 0 ? "KIND=event" : "KIND=begin", "SUBSYSTEM=a"});
    } else {
      addEntry(writer, {tellsOfLoss(i) ? kLoss : "MESSAGE_ID=" + std::to_string(i % 3)});
    }
  }
  return writer;
}

uint64_t wordAt(const std::string& file, uint64_t at) {
  return load<uint64_t>(reinterpret_cast<const uint8_t*>(file.data()) + at);
}

class MarkedEntriesTest : public ::testing::TestWithParam<bool> {
 protected:
  JournalLayout layout() const { return {.compact = GetParam()}; }

  // The numbers of the entries that were shown with fields, among them `field`.
  Numbers shown(const std::string& bytes, const std::vector<EntryMark>& marks = kMarks,
                std::string_view field = "MESSAGE=") {
    testing::RecordingTokenizer tokenizer(marks);
    const StopFlag stop{false};
    auto opened = JournalStore::open(directory_.write("a.journal", bytes), {}, tokenizer, stop);
    Numbers numbers;
    if (opened.index() == 1) return numbers;
    EntryStream& entries = std::get<0>(opened)->entries();
    while (entries.next()) {
      const Entry entry = entries.entry();
      if (std::any_of(entry.tokens.begin(), entry.tokens.end(),
                      [&](FieldToken token) { return tokenizer.text(token).starts_with(field); }))
        numbers.insert(entry.header.sequenceNumber);
    }
    const StoreReport report = std::get<0>(opened)->report();
    problem_ = report.files[0].problems.empty() ? "" : report.files[0].problems.all()[0].words;
    return numbers;
  }

  testing::TemporaryDirectory directory_;
  std::string problem_;  // the first problem of the last reading
};

INSTANTIATE_TEST_SUITE_P(Layouts, MarkedEntriesTest, ::testing::Bool());

TEST_P(MarkedEntriesTest, ShowsOnlyMarksAndLosses) {
  Numbers expected;
  for (uint64_t i = 1; i <= kJournalSize; ++i)
    if (isMarked(i) || tellsOfLoss(i)) expected.insert(i);
  EXPECT_EQ(shown(markedJournal(layout()).bytes()), expected);
}

TEST_P(MarkedEntriesTest, ShowsAllWithoutAUsableIndex) {
  JournalWriter writer = markedJournal(layout());
  addEntry(writer, {"SUBSYSTEM=b"});
  EXPECT_EQ(shown(writer.bytes()).size(), kJournalSize + 1) << "a companion alone";
  for (const char* field : {"SUBSYSTEM=", "KIND=", "NAME"}) {
    JournalWriter many = markedJournal(layout());
    for (int i = 0; i < 5000; ++i) addEntry(many, {field + std::to_string(i) + "=x"});
    EXPECT_EQ(shown(many.bytes()).size(), kJournalSize + 5000) << "too many of " << field;
  }
  for (const JournalLayout& other :
       {JournalLayout{.compact = GetParam(), .state = kOnline},
        JournalLayout{.compact = GetParam(), .headerSize = 208},
        JournalLayout{.compact = GetParam(), .compression = kZstd, .compressFrom = 8}})
    EXPECT_EQ(shown(markedJournal(other).bytes()).size(), kJournalSize);
}

TEST_P(MarkedEntriesTest, ADamagedIndexHidesNoMark) {
  const JournalWriter writer = markedJournal(layout());
  const std::string good = writer.bytes();
  const uint64_t buckets = wordAt(good, kFieldTableAt);
  const uint64_t data = writer.dataOf("KIND=event");
  const uint64_t newest = std::max(data, writer.dataOf("KIND=begin"));
  const std::vector<uint64_t>& arrays = writer.arraysOf("KIND=event");
  const size_t item = layout().compact ? 4 : 8;
  const uint64_t far = good.size() - 64;
  using Fault = std::function<void(std::string&)>;
  const std::pair<const char*, Fault> faults[] = {
      {"field table elsewhere", [&](auto& file) { put(file, kFieldTableAt, buckets + 8); }},
      {"field table too long", [&](auto& file) { put(file, kFieldTableSizeAt, UINT64_MAX); }},
      {"buckets zeroed", [&](auto& file) { file.replace(buckets, 64, 64, '\0'); }},
      {"buckets garbled", [&](auto& file) { file.replace(buckets, 64, 64, '\x18'); }},
      {"value linked to itself", [&](auto& file) { put(file, newest + kNextValueAt, newest); }},
      {"older value cut off", [&](auto& file) { put(file, newest + kNextValueAt, 0); }},
      {"value zeroed", [&](auto& file) { file.replace(data, 64, 64, '\0'); }},
      {"no entries", [&](auto& file) { put(file, data + kDataEntryCountAt, 0); }},
      {"one entry less",
       [&](auto& file) { put(file, data + kDataEntryCountAt, kJournalSize / 10 - 1); }},
      {"one entry more",
       [&](auto& file) { put(file, data + kDataEntryCountAt, kJournalSize / 10 + 1); }},
      {"first entry is none", [&](auto& file) { put(file, data + kDataFirstEntryAt, data); }},
      {"first entry is far behind", [&](auto& file) { put(file, data + kDataFirstEntryAt, far); }},
      {"last of an array is far behind",
       [&](auto& file) {
         std::memcpy(file.data() + arrays[2] + kArrayItemsAt + 15 * item, &far, item);
       }},
      {"list elsewhere", [&](auto& file) { put(file, data + kDataEntryArrayAt, data); }},
      {"list cut off", [&](auto& file) { put(file, arrays[1] + kArrayNextAt, 0); }},
      {"list in a circle", [&](auto& file) { put(file, arrays[2] + kArrayNextAt, arrays[0]); }},
      {"list zeroed", [&](auto& file) { file.replace(arrays[3], 64, 64, '\0'); }},
      {"list ends early",
       [&](auto& file) { file.replace(arrays[3] + kArrayItemsAt, 64, 64, '\0'); }},
      {"descending",
       [&](auto& file) {
         file.replace(arrays[3] + kArrayItemsAt + 2 * item, item, file, arrays[0] + kArrayItemsAt,
                      item);
       }},
  };
  for (const auto& [name, fault] : faults) {
    std::string file = good;
    fault(file);
    const Numbers seen = shown(file);
    for (uint64_t i = 1; i <= kJournalSize; ++i)
      EXPECT_TRUE(!isMarked(i) || seen.contains(i)) << name << " " << i;
  }
}

// A wrong offset in a list hides the entry whose offset it replaced, and no other.
TEST_P(MarkedEntriesTest, AWrongOffsetHidesOneEntry) {
  const JournalWriter writer = markedJournal(layout());
  std::string file = writer.bytes();
  const uint64_t item = writer.arraysOf("KIND=event")[3] + kArrayItemsAt;
  file[item] = static_cast<char>(file[item] + 8);
  const Numbers seen = shown(file);
  uint64_t found = 0;
  for (const uint64_t number : seen) found += isMarked(number);
  EXPECT_EQ(found, kJournalSize / 5 - 1);
  EXPECT_EQ(problem_, "list of entries damaged");
}

TEST_P(MarkedEntriesTest, LosesNextToNothingToRandomDamage) {
  const char* wanted = std::getenv("TESSEL_DAMAGE_ROUNDS");
  const uint64_t rounds = wanted != nullptr ? std::strtoull(wanted, nullptr, 10) : 100;
  const std::string file = markedJournal(layout()).bytes();
  for (uint64_t seed = 0; seed < rounds; ++seed) {
    const std::string damaged = testing::damaged(file, seed);
    const Numbers there = shown(damaged, {}, "KIND=");
    const Numbers seen = shown(damaged, kMarks, "KIND=");
    EXPECT_LE(there.size(), seen.size() + 1) << seed;
  }
}

}  // namespace
}  // namespace tessel
