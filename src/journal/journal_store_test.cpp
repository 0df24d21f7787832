// Stores of files of every kind. What the journal's own tools write is read beside libsystemd and
// journalctl in tests/reading.

#include "journal/JournalStore.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <random>

#include "journal/ExportEntryStream.h"
#include "journal/JournalFormat.h"
#include "journal/LossTokenizer.h"
#include "journal/testing/JournalBender.h"
#include "journal/testing/JournalOracle.h"
#include "journal/testing/JournalWriter.h"
#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using ::testing::HasSubstr;
using testing::JournalLayout;
using testing::JournalWriter;
using testing::PlainEntry;
using testing::TemporaryDirectory;

struct Reading {
  std::vector<PlainEntry> entries;
  StoreReport report;
  std::string error;
  ErrorCode code = ErrorCode::failed;
};

Reading readStore(const std::string& path, TimeRange range = {}, ServiceStatus* status = nullptr) {
  testing::RecordingTokenizer tokenizer;
  StopFlag stop{false};
  auto opened = JournalStore::open(path, range, tokenizer, stop, status);
  if (auto* error = std::get_if<PlatformError>(&opened)) return {{}, {}, error->words, error->code};
  JournalStore& store = *std::get<0>(opened);
  Reading reading;
  reading.entries = testing::readAll(store.entries(), tokenizer);
  reading.report = store.report();
  return reading;
}

std::vector<uint64_t> numbers(const Reading& reading) {
  std::vector<uint64_t> all;
  for (const PlainEntry& entry : reading.entries) all.push_back(entry.header.sequenceNumber);
  return all;
}

std::string someJournal(size_t count, uint64_t firstSequence = 1, JournalLayout layout = {}) {
  JournalWriter writer(layout);
  writer.addSome(count, firstSequence);
  return writer.bytes();
}

TEST(JournalStoreTest, ReadsAllLayoutsLikeLibsystemd) {
  using namespace journal_format;
  const JournalLayout layouts[] = {
      {.compression = kXz},
      {.compression = kLz4},
      {.compression = kZstd},
      {.compact = true, .compression = kXz},
      {.headerSize = 240},
      {.headerSize = 256, .state = kOffline},
      {.headerSize = 264, .state = kOnline},
      {.headerSize = 272},
      {.sealEvery = 10},
      {.compact = true, .compression = kLz4, .headerSize = 272, .sealEvery = 3},
  };
  const TemporaryDirectory directory;
  for (const JournalLayout& layout : layouts) {
    const std::string path = directory.write("one.journal", someJournal(500, 1, layout));
    const Reading reading = readStore(path);
    const size_t number = static_cast<size_t>(&layout - layouts);
    EXPECT_EQ(reading.entries.size(), 500u) << number;
    EXPECT_TRUE(reading.entries == testing::readWithLibsystemd({path})) << number;
    EXPECT_TRUE(reading.report.files.at(0).problems.empty()) << number;
  }
}

TEST(JournalStoreTest, DeliversCopiesInOtherFilesOnce) {
  const TemporaryDirectory directory;
  const std::string first = directory.write("a.journal", someJournal(20, 1));
  std::filesystem::create_hard_link(first, directory.path("another_name.journal"));
  std::filesystem::create_symlink(first, directory.path("link.journal"));
  directory.write("b.journal", someJournal(20, 11));
  directory.write("c.journal", someJournal(5, 15));
  JournalWriter twice({.sequenceId = {9}});
  twice.addSome(1, 1);
  twice.addSome(1, 1);
  directory.write("twice.journal", twice.bytes());
  // An export is merged with the sequence that its entries are from, not in it.
  std::string exported;
  for (const PlainEntry& entry : readStore(first).entries)
    exported += "__CURSOR=" + cursorOf(entry.header) +
                "\n__REALTIME_TIMESTAMP=" + std::to_string(entry.header.realtime) +
                "\n__MONOTONIC_TIMESTAMP=" + std::to_string(entry.header.monotonic) + "\n\n";
  directory.write("a.export", exported);
  const Reading reading = readStore(directory.path());
  EXPECT_EQ(reading.entries.size(), 32u);
  EXPECT_EQ(reading.report.reading.entriesRead, 32u);
  EXPECT_EQ(reading.report.reading.duplicateEntries, 35u);
  EXPECT_EQ(reading.report.files.size(), 5u) << "a file of several names is read once";
}

// The sequences have overlapping boots and clocks that were set, so no order satisfies all rules.
TEST(JournalStoreTest, DeliversOnceInACircularOrder) {
  constexpr size_t kEntries = 60;
  for (unsigned seed = 0; seed < 10; ++seed) {
    std::mt19937 random(seed);
    const TemporaryDirectory directory;
    for (uint8_t sequence = 1; sequence <= 4; ++sequence) {
      JournalWriter writer({.sequenceId = {sequence}});
      EntryHeader header;
      for (size_t i = 0; i < kEntries; ++i) {
        if (i % 20 == 0) header.bootId = {static_cast<uint8_t>(random() % 3)};
        if (i % 20 == 0) header.monotonic = 1 + random() % 50;
        if (i % 15 == 0) header.realtime = 1000 + random() % 50;
        header.monotonic += 1 + random() % 3;
        header.realtime += 1 + random() % 3;
        writer.add(header, {"MESSAGE=" + std::to_string(random())});
        // Writes a copy of the first half, and then one of the whole file.
        if (i % 30 == 29)
          directory.write(std::to_string(sequence) + (i > 30 ? "" : "early") + ".journal",
                          writer.bytes());
      }
      directory.write(std::to_string(sequence) + "copy.journal", writer.bytes());
    }
    const Reading reading = readStore(directory.path());
    std::map<Id128, std::vector<uint64_t>> numbers;
    for (const PlainEntry& entry : reading.entries)
      numbers[entry.header.sequenceId].push_back(entry.header.sequenceNumber);
    EXPECT_EQ(reading.entries.size(), 4 * kEntries) << seed;
    EXPECT_EQ(reading.report.reading.duplicateEntries, 4 * (kEntries + 30)) << seed;
    EXPECT_EQ(reading.report.reading.losses.sum(LossCode::entriesMissing), 0u) << seed;
    for (const auto& [sequence, all] : numbers)
      EXPECT_TRUE(std::is_sorted(all.begin(), all.end())) << seed;
  }
}

TEST(JournalStoreTest, SkipsClosedFilesOutsideTheRange) {
  const TemporaryDirectory directory;
  constexpr uint64_t kBase = 1'795'300'000'000'000;
  directory.write("a.journal", someJournal(10, 1));
  directory.write("b.journal", someJournal(10, 11));
  directory.write("live.journal", someJournal(5, 30, {.state = journal_format::kOnline}));
  const Reading reading = readStore(directory.path(), {kBase + 13'000'000, kBase + 16'000'000});
  EXPECT_EQ(numbers(reading), (std::vector<uint64_t>{13, 14, 15}));
  EXPECT_EQ(reading.report.files.at(0).skipped, "outside the range");
  EXPECT_TRUE(reading.report.files.at(0).outsideRange);
  EXPECT_EQ(reading.report.files.at(1).entriesRead, 3u);
  EXPECT_FALSE(reading.report.files.at(2).skipped);
  EXPECT_EQ(reading.report.reading.oldestEntry, kBase + 1'000'000);
  EXPECT_TRUE(reading.report.reading.reachesRangeStart());
  EXPECT_EQ(reading.report.reading.outsideRange, std::vector{directory.path("a.journal")});
  // A wrong word in the header does not hide the file.
  std::string file = someJournal(10, 11);
  testing::put(file, journal_format::kTailRealtimeAt, kBase + 12'000'000);
  directory.write("b.journal", file);
  EXPECT_EQ(readStore(directory.path(), {kBase + 13'000'000, kBase + 16'000'000}).entries.size(),
            3u);
}

TEST(JournalStoreTest, FiltersEachEntryByASetBackClock) {
  const TemporaryDirectory directory;
  JournalWriter system, user({.sequenceId = {9}});
  for (uint64_t i = 1; i <= 40; ++i) {
    EntryHeader header;
    header.bootId = {1};
    header.monotonic = 10 * i;
    header.realtime = 1000 + i - (i > 20 ? 30 : 0);
    system.add(header, {"PRIORITY=6"});
    header.monotonic += 5;
    if (i == 22) user.add(header, {"_UID=1000"});
  }
  const std::string a = directory.write("system.journal", system.bytes());
  const std::string b = directory.write("user-1000.journal", user.bytes());
  const Reading all = readStore(directory.path());
  EXPECT_TRUE(all.entries == testing::readWithLibsystemd({a, b}));
  EXPECT_EQ(all.entries.at(22).fields, std::vector<std::string>{"_UID=1000"});
  EXPECT_EQ(numbers(readStore(directory.path(), {1005, 1008})),
            (std::vector<uint64_t>{5, 6, 7, 35, 36, 37}));
  EXPECT_EQ(numbers(readStore(a, {999, 1002})), (std::vector<uint64_t>{1, 29, 30, 31}));
  // Its header has the times of the first and the last entry, and the range lies behind both.
  JournalWriter back;
  for (const uint64_t time : {2000u, 2005u, 1000u})
    back.add({.monotonic = 3000 - time, .realtime = time}, {"PRIORITY=6"});
  EXPECT_EQ(numbers(readStore(directory.write("back.journal", back.bytes()), {2003, 2008})),
            (std::vector<uint64_t>{2}));
}

// One daemon numbers the entries of all its files, though a user's file has a sequence of its own.
TEST(JournalStoreTest, MissesOnlyNumbersThatNoFileHolds) {
  const TemporaryDirectory directory;
  JournalWriter system, user({.sequenceId = {9}});
  for (uint64_t i = 1; i <= 300; ++i) {
    EntryHeader header{{}, i, {1}, i * 10, 1000 + i * 10, 0};
    if (i == 20) header.sequenceNumber += uint64_t{1} << 30;  // a flipped bit
    (i % 3 == 0 ? user : system).add(header, {"PRIORITY=6"});
  }
  const Reading whole = [&] {
    directory.write("system.journal", system.bytes());
    directory.write("user-1000.journal", user.bytes());
    return readStore(directory.path());
  }();
  EXPECT_EQ(whole.report.reading.missingNumbers, 1u) << "that of the entry with the wrong one";
  directory.write("system.journal", someJournal(10, 1));
  directory.write("user-1000.journal", someJournal(10, 14));
  const Reading gap = readStore(directory.path());
  EXPECT_EQ(gap.report.reading.sequenceGaps, 1u);
  EXPECT_EQ(gap.report.reading.missingNumbers, 3u);
  EXPECT_TRUE(gap.report.reading.losses.empty()) << "the daemon may have removed them";
  directory.write("noise.journal", "noise");
  EXPECT_EQ(readStore(directory.path()).report.reading.losses.sum(LossCode::entriesMissing), 3u);
  const std::string last = "__REALTIME_TIMESTAMP=1\n__SEQNUM_ID=" + std::string(32, 'a') +
                           "\n__SEQNUM=18446744073709551615\n\n";
  EXPECT_EQ(readStore(directory.write("a.export", last + last)).report.reading.sequenceGaps, 0u);
}

TEST(JournalStoreTest, TellsWhatTheDaemonDropped) {
  const TemporaryDirectory directory;
  JournalWriter writer;
  EntryHeader header;
  header.realtime = header.monotonic = 1;
  const std::string message = "MESSAGE_ID=a596d6fe7bfa4994828e72309e95d61e";
  const std::string daemon = "_TRANSPORT=driver";
  writer.add(header, {message, "N_DROPPED=12", "OBJECT_SYSTEMD_UNIT=a.service", daemon});
  writer.add(header,
             {"MESSAGE_ID=other", "N_DROPPED=100", "OBJECT_SYSTEMD_UNIT=a.service", daemon});
  writer.add(header,
             {message, "N_DROPPED=5", "OBJECT_SYSTEMD_UNIT=a.service", "PRIORITY=4", daemon});
  writer.add(header,
             {message, "N_DROPPED=7", "OBJECT_SYSTEMD_UNIT=a.service", "_TRANSPORT=journal"});
  writer.add(header, {message, "N_DROPPED=1", daemon});
  const Reading reading = readStore(directory.write("a.journal", writer.bytes()));
  const auto& dropped = reading.report.reading.losses.all();
  ASSERT_EQ(dropped.size(), 2u);
  EXPECT_EQ(dropped[0].place.name, "");
  EXPECT_EQ(dropped[0].count, 1u);
  EXPECT_EQ(dropped[1].place.name, "a.service");
  EXPECT_EQ(dropped[1].count, 17u);
  EXPECT_EQ(reading.entries.at(2).fields, (std::vector<std::string>{"PRIORITY=4"}));
}

// Anyone may write loss messages, with any values.
TEST(JournalStoreTest, CountsEachOfManyLosses) {
  const TemporaryDirectory directory;
  JournalWriter writer;
  EntryHeader header;
  header.realtime = header.monotonic = 1;
  const std::string message = "MESSAGE_ID=a596d6fe7bfa4994828e72309e95d61e";
  const std::string daemon = "_TRANSPORT=driver";
  constexpr uint64_t kLosses = 5000;
  static_assert(kLosses > LossTokenizer::kMaxUnits);
  for (uint64_t i = 1; i <= kLosses; ++i) {
    const std::string number = std::to_string(i);
    writer.add(header, {message, "N_DROPPED=" + number, "OBJECT_SYSTEMD_UNIT=u" + number, daemon});
  }
  const std::string tooLong(LossTokenizer::kMaxUnitLength + 1, 'u');
  writer.add(header, {message, "N_DROPPED=1", "OBJECT_SYSTEMD_UNIT=" + tooLong, daemon});
  writer.add(header, {message, "N_DROPPED=some", daemon});
  const Reading reading = readStore(directory.write("a.journal", writer.bytes()));
  const Losses& losses = reading.report.reading.losses;
  EXPECT_EQ(losses.sum(LossCode::droppedByDaemon), kLosses * (kLosses + 1) / 2 + 1);
  ASSERT_EQ(losses.all().size(), Losses::kMaxOfACode + 1);
  EXPECT_EQ(losses.all()[0].place.name, "") << "904 units were too many to tell apart";
  EXPECT_EQ(losses.all()[1].count, LossTokenizer::kMaxUnits) << "then those that lost most";
}

TEST(JournalStoreTest, SaysWhyThereIsNoStore) {
  const TemporaryDirectory directory;
  const std::string noise = directory.write("noise/noise.journal", std::string(5000, '\x5a'));
  EXPECT_THAT(readStore("/nowhere").error, HasSubstr("/nowhere: No such file"));
  EXPECT_THAT(readStore(noise).error, HasSubstr(noise + ": not a journal file"));
  EXPECT_THAT(readStore(directory.path("noise")).error, HasSubstr("not a journal file"));
  std::filesystem::create_directory(directory.path("empty"));
  EXPECT_THAT(readStore(directory.path("empty")).error, HasSubstr("holds no *.journal"));
  EXPECT_THAT(readStore("/dev/null").error, HasSubstr("neither a directory nor a file"));
  EXPECT_EQ(readStore("/nowhere").code, ErrorCode::notFound);
  EXPECT_EQ(readStore(noise).code, ErrorCode::notAStore);
  EXPECT_EQ(readStore(directory.path("empty")).code, ErrorCode::notAStore);
}

TEST(JournalStoreTest, ReadsTheGoodFilesAmongBadOnes) {
  const TemporaryDirectory directory;
  directory.write("bad.journal", std::string(5000, '\x5a'));
  directory.write("cut.journal", "");
  std::filesystem::last_write_time(directory.path("cut.journal"), {});
  directory.write("good.journal~", someJournal(10));
  directory.write("new.journal", "");
  const Reading reading = readStore(directory.path());
  EXPECT_EQ(reading.entries.size(), 10u);
  EXPECT_EQ(reading.report.files.at(0).skipped, "not a journal file");
  EXPECT_EQ(reading.report.files.at(1).skipped, "it is empty");
  EXPECT_EQ(reading.report.reading.losses.all().size(), 2u) << "new.journal lost nothing";
}

// The journalctl of this machine does not know the flag either, so the test sees it read nothing. A
// file that only journalctl can read is not at hand.
TEST(JournalStoreTest, LeavesUnknownFilesToJournalctl) {
  const TemporaryDirectory directory;
  std::string file = someJournal(10);
  file[journal_format::kIncompatibleFlagsAt + 3] = 0x40;
  directory.write("foreign.journal", file);
  file.replace(journal_format::kEntryCountAt, 8, 8, '\xff');
  directory.write("foreign_boast.journal", file);
  directory.write("known.journal", someJournal(10));
  const Reading reading = readStore(directory.path());
  EXPECT_EQ(reading.entries.size(), 10u);
  ASSERT_FALSE(reading.report.files.at(0).problems.empty());
  const Loss& last = reading.report.files.at(0).problems.all().back();
  EXPECT_EQ(last.words, "entries that journalctl did not read");
  EXPECT_EQ(last.count, 10u);
  EXPECT_LE(reading.report.files.at(1).problems.all().back().count, file.size())
      << "no more than the file can hold";
}

// Otherwise the reader would decompress the value for each of the entry's items.
TEST(JournalStoreTest, DecompressesARepeatedValueOnce) {
  const TemporaryDirectory directory;
  JournalLayout layout;
  layout.compression = journal_format::kZstd;
  JournalWriter writer(layout);
  writer.add({.realtime = 1},
             std::vector<std::string>(1000, "TESSEL_NAME=" + std::string(4000, 'x')));
  std::string file = writer.bytes();
  const uint64_t thousand = 1000;
  const uint64_t one = 1;
  const size_t count =
      file.find(std::string(reinterpret_cast<const char*>(&thousand), 8), layout.headerSize);
  ASSERT_NE(count, std::string::npos);
  file.replace(count, 8, reinterpret_cast<const char*>(&one), 8);
  const std::string path = directory.write("a.journal", file);
  testing::RecordingTokenizer tokenizer;
  const StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  ASSERT_EQ(testing::readAll(std::get<0>(opened)->entries(), tokenizer).at(0).fields.size(), 1000u);
  EXPECT_EQ(tokenizer.shown(), 1u);
}

// Otherwise the watchdog would end a run that opens thousands of files from a slow disk, or that
// passes over days of entries to reach its own.
TEST(JournalStoreTest, OpeningFilesAndPassingOverEntriesIsProgress) {
  const TemporaryDirectory directory;
  const TimeRange future{UINT64_MAX - 1, UINT64_MAX};
  for (int i = 0; i < 5; ++i) directory.write(std::to_string(i) + ".journal", someJournal(1));
  testing::FakeServiceStatus status;
  EXPECT_TRUE(readStore(directory.path(), future, &status).entries.empty());
  EXPECT_GE(status.steps, 5u + 5u) << "found, opened";
  std::string text;
  for (int i = 1; i <= 640; ++i)
    text += "__REALTIME_TIMESTAMP=" + std::to_string(i) +
            "\n__MONOTONIC_TIMESTAMP=1\n_BOOT_ID=" + std::string(32, 'a') + "\nMESSAGE=old\n\n";
  status.steps = 0;
  EXPECT_TRUE(readStore(directory.write("old.export", text), future, &status).entries.empty());
  EXPECT_GE(status.steps, 1u + 1u + 640u / 64);
}

TEST(JournalStoreTest, ReadsOnlySomeUnknownFiles) {
  const TemporaryDirectory directory;
  std::string file = someJournal(1);
  file[journal_format::kIncompatibleFlagsAt + 3] = 0x40;
  for (size_t i = 0; i <= JournalStore::kMaxForeignFiles; ++i)
    directory.write(std::to_string(100 + i) + ".journal", file);
  const Reading reading = readStore(directory.path());
  for (size_t i = 0; i < JournalStore::kMaxForeignFiles; ++i)
    EXPECT_EQ(reading.report.files.at(i).skipped, std::nullopt) << i;
  EXPECT_THAT(reading.report.files.back().skipped.value_or(""), HasSubstr("16 files before it"));
}

TEST(JournalStoreTest, JournalctlReadsForUsWhatItKnows) {
  const TemporaryDirectory directory;
  const std::string path = directory.write("[a]*.journal", someJournal(100));
  testing::RecordingTokenizer tokenizer;
  const StopFlag stop{false};
  WindowBudget windows;
  ExportReadResources resources{windows};
  for (const auto& [counted, missing] : {std::pair{100u, 0u}, {60u, 0u}, {103u, 3u}}) {
    FileReport report;
    const auto stream =
        ForeignJournalStream::start(path, counted, resources, tokenizer, stop, report);
    ASSERT_NE(stream, nullptr);
    EXPECT_EQ(testing::readAll(*stream, tokenizer).size(), 100u);
    EXPECT_EQ(report.problems.sum(LossCode::fileDamaged), missing) << counted;
  }
}

}  // namespace
}  // namespace tessel
