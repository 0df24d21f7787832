// Journals that were made to take long are read a few times over, and no more.

#include <gtest/gtest.h>

#include <array>
#include <cstring>
#include <fstream>

#include "journal/Decompressor.h"
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

// A journal of entries that name one value in each of their items and do not match their hash.
std::string journalOfOneValue(JournalLayout layout, uint8_t compression, const std::string& payload,
                              size_t entries, size_t items = 2000) {
  JournalWriter writer(layout);
  std::vector<std::string> others;
  for (size_t i = 0; i < items; ++i) others.push_back("A=" + std::to_string(i));
  for (uint64_t i = 1; i <= entries; ++i) writer.add({.realtime = i}, others);
  std::string file = writer.bytes();
  const uint64_t value = file.size();
  for (const uint64_t entry : writer.entries())
    for (size_t item = 0; item < items; ++item)
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

// Every 16 bytes there could be an object. By its size each ends far away, in zeros that do not
// reach the end of the file. The search must not look through these zeros for each object.
std::string journalOfFarEnds(JournalLayout layout) {
  constexpr size_t kHalf = size_t{1} << 20;
  std::string file = JournalWriter(layout).bytes();
  const size_t start = file.size();
  file.resize(start + 2 * kHalf);
  put(file, kEntryCountAt, 1);
  for (size_t at = start; at < start + kHalf; at += 16) {
    file[at] = kData;
    put(file, at + kObjectSizeAt, start + kHalf - at + at % 8000);
  }
  file.back() = 1;
  return file;
}

// Bytes that this thread has read from files.
uint64_t bytesRead() {
  std::ifstream counts("/proc/thread-self/io");
  std::string name;
  uint64_t bytes = 0;
  counts >> name >> bytes;
  return bytes;
}

bool tellsOfDamage(const std::string& path) {
  testing::RecordingTokenizer tokenizer({"MESSAGE="});
  const StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  while (std::get<0>(opened)->entries().next()) std::get<0>(opened)->entries().entry();
  return !std::get<0>(opened)->report().files.at(0).problems.empty();
}

class JournalCostTest : public ::testing::TestWithParam<bool> {};

INSTANTIATE_TEST_SUITE_P(Layouts, JournalCostTest, ::testing::Bool());

// Each of these files leads to the same bytes again and again: gigabytes, if they were all read.
TEST_P(JournalCostTest, ReadsFilesMadeToTakeLongAFewTimesOver) {
  const testing::TemporaryDirectory directory;
  const JournalLayout layout{.compact = GetParam()};
  // The beginning of a frame of ZSTD. Zeros are blocks in which nothing is.
  const std::string frame("\x28\xb5\x2f\xfd\0\x58", 6);
  for (const std::string& file :
       {journalOfOneValue(layout, 0, "MESSAGE=" + std::string(60'000, 'x'), 20),
        journalOfOneValue(layout, kZstd, frame + std::string(1 << 20, '\0'), 1),
        journalOfOneValue(layout, kZstd, frame + std::string(1 << 20, '\0'), 2000, 1),
        journalOfOverlappingEntries(layout), journalOfFarEnds(layout)}) {
    const std::string path = directory.write("a.journal", file);
    const uint64_t before = bytesRead();
    EXPECT_TRUE(tellsOfDamage(path));
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

}  // namespace
}  // namespace tessel
