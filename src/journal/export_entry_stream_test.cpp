// The Journal Export Format: both forms of a field, damage, growth while it is read.

#include "journal/ExportEntryStream.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/mman.h>
#include <unistd.h>

#include "journal/EntryStream.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using Lines = std::vector<std::string>;

// Wants the fields whose names begin with T, and remembers their texts. If a value was cut, its
// text is shortened and ends with a slash and the size of the whole value.
class RecordingTokenizer final : public FieldTokenizer {
 public:
  bool wants(std::string_view name) const override {
    ++asked;
    if (name == "STOP") *stop = true;
    return name.starts_with('T');
  }
  FieldToken tokenFor(std::string_view field, std::string_view value, uint64_t size) override {
    texts.push_back(std::string(field) + "=" + std::string(value));
    if (size != value.size()) texts.back() = texts.back().substr(0, 6) + "/" + std::to_string(size);
    return static_cast<FieldToken>(texts.size());
  }
  const uint32_t& generation() const override { return generation_; }
  Lines texts;
  mutable size_t asked = 0;
  StopFlag* stop = nullptr;  // set where a field is named STOP

 private:
  uint32_t generation_ = 0;
};

std::string binary(std::string_view name, std::string_view value,
                   std::optional<uint64_t> length = {}) {
  std::string field = std::string(name) + "\n";
  uint64_t stated = length.value_or(value.size());
  for (int i = 0; i < 8; ++i, stated >>= 8) field += static_cast<char>(stated & 0xff);
  return field + std::string(value) + "\n";
}

// The parameter is the number of other files. With many of them the window is as small as possible.
class ExportEntryStreamTest : public ::testing::TestWithParam<size_t> {
 protected:
  ExportEntryStreamTest()
      : file_(::memfd_create("export", 0)),
        stream_(::dup(file_), resources_, tokenizer_, stop, report) {
    for (size_t i = 0; i < GetParam(); ++i) windows_.join();
  }
  ~ExportEntryStreamTest() override { ::close(file_); }

  // Writes at the end of the file without moving the offset from which the stream reads.
  void append(std::string_view text) {
    ASSERT_EQ(::pwrite(file_, text.data(), text.size(), size_), ssize_t(text.size()));
    size_ += static_cast<off_t>(text.size());
  }
  // Reads to the end. One line for each entry: its time and its wanted fields.
  Lines readAll() {
    Lines lines;
    while (stream_.next()) {
      tokenizer_.texts.clear();
      const Entry entry = stream_.entry();
      lines.push_back(std::to_string(entry.header.realtime) + ":");
      EXPECT_EQ(entry.tokens.size(), tokenizer_.texts.size());
      for (const std::string& text : tokenizer_.texts) lines.back() += " " + text;
    }
    return lines;
  }
  Lines problems() const {
    Lines lines;
    for (const Loss& problem : report.problems.all()) {
      lines.push_back(problem.words + " at " + std::to_string(problem.place.offset.value()) + " x" +
                      std::to_string(problem.count));
    }
    return lines;
  }
  const EntryHeader& header() const { return stream_.header(); }
  bool next() { return stream_.next(); }

  StopFlag stop = false;
  FileReport report;
  RecordingTokenizer tokenizer_;

 private:
  WindowBudget windows_;
  ExportReadResources resources_{windows_};
  int file_;
  off_t size_ = 0;
  ExportEntryStream stream_;
};

INSTANTIATE_TEST_SUITE_P(OtherFiles, ExportEntryStreamTest, ::testing::Values(0, 20'000));

constexpr std::string_view kGood = "__REALTIME_TIMESTAMP=7\nT=good\n\n";

TEST_P(ExportEntryStreamTest, readsBothFormsOfAField) {
  append("__REALTIME_TIMESTAMP=5\nT=a=b\nMESSAGE=x\n");
  append(binary("T", "two\nlines\n\n") + binary("MESSAGE", "\n\n") + binary("T", "") + "\n\n\n");
  append(kGood);
  EXPECT_THAT(readAll(), ElementsAre("5: T=a=b T=two\nlines\n\n T=", "7: T=good"));
  EXPECT_THAT(problems(), IsEmpty());
}

TEST_P(ExportEntryStreamTest, readsWhereAnEntryStands) {
  append(
      "__CURSOR=s=000102030405060708090a0b0c0d0e0f;i=a1;b=ffffffffffffffffffffffffffffffff;m=2;t=3;"
      "x=4\n"
      "__REALTIME_TIMESTAMP=1795379995114272\n__MONOTONIC_TIMESTAMP=99\n"
      "_BOOT_ID=101112131415161718191a1b1c1d1e1f\n\n"
      "__REALTIME_TIMESTAMP=1\n__SEQNUM=12\n__SEQNUM_ID=000102030405060708090a0b0c0d0e0f\n\n");
  ASSERT_TRUE(next());
  EXPECT_EQ(cursorOf(header()),
            "s=000102030405060708090a0b0c0d0e0f;i=a1;b=101112131415161718191a1b1c1d1e1f;m=63;"
            "t=660e37ad87b20;x=4");
  ASSERT_TRUE(next());
  EXPECT_EQ(header().sequenceNumber, 12u);
  EXPECT_EQ(header().sequenceId[15], 15);
  EXPECT_EQ(header().bootId, Id128{});
}

TEST_P(ExportEntryStreamTest, showsOnlyTheHeadOfALongValue) {
  const std::string longValue(300'000, 'x');
  append("__REALTIME_TIMESTAMP=1\nT=" + longValue + "\n" + binary("T", longValue) +
         "MESSAGE=" + longValue + "\n\n");
  append(kGood);
  EXPECT_THAT(readAll(), ElementsAre("1: T=xxxx/300000 T=xxxx/300000", "7: T=good"));
}

TEST_P(ExportEntryStreamTest, goesOnAfterBadData) {
  const std::string time = "__REALTIME_TIMESTAMP=1\n";
  const struct {
    std::string text;
    std::string problem;
  } cases[] = {
      {time + "no field\nT=x\n\n", "line that is no field"},
      {"T=x\n\n", "entry without __REALTIME_TIMESTAMP"},
      {"__REALTIME_TIMESTAMP=-1\n\n", "invalid __REALTIME_TIMESTAMP"},
      {"__REALTIME_TIMESTAMP=99999999999999999999\n\n", "invalid __REALTIME_TIMESTAMP"},
      {time + "__MONOTONIC_TIMESTAMP=\n\n", "invalid __MONOTONIC_TIMESTAMP"},
      {time + "T=x\n" + time + "T=y\n\n", "two entries without an empty line between"},
      {time + binary("T", "abc", 2) + "\n", "value of another length than stated"},
      {time + binary("T", "abc\n\n" + std::string(kGood), 20) + "\n",
       "value of another length than stated"},
      {time + binary("T", "abc", ~uint64_t{0}) + "\n", "value longer than any"},
  };
  uint64_t bad = 0;
  for (const auto& c : cases) {
    append(c.text);
    append(kGood);
    EXPECT_THAT(readAll(), ::testing::Contains("7: T=good")) << c.text;
    EXPECT_EQ(report.problems.sum(LossCode::fileDamaged), ++bad) << c.text;
    EXPECT_THAT(problems(), ::testing::Contains(::testing::StartsWith(c.problem))) << c.text;
  }
}

TEST_P(ExportEntryStreamTest, anEntryWithTooMuchInItIsBad) {
  std::string text = "__REALTIME_TIMESTAMP=1\n";
  for (size_t i = 0; i <= ExportEntryStream::kMaxFieldsKept; ++i) text += "T=x\n";
  append(text + "\n");
  append(kGood);
  EXPECT_THAT(readAll(), ElementsAre("7: T=good"));
  EXPECT_THAT(problems(), ElementsAre("entry with too many fields at 0 x1"));
}

TEST_P(ExportEntryStreamTest, anEntryEndsWithItsEmptyLine) {
  const std::string entry = "__REALTIME_TIMESTAMP=3\n" + binary("T", "a\n\nb") + "T=c\n\n";
  for (const char& byte : entry) {
    EXPECT_THAT(readAll(), IsEmpty());
    append(std::string(1, byte));
  }
  append("__REALTIME");
  EXPECT_THAT(readAll(), ElementsAre("3: T=a\n\nb T=c"));
  append("_TIMESTAMP=4\n\n");
  EXPECT_THAT(readAll(), ElementsAre("4:"));
  EXPECT_THAT(problems(), ElementsAre("incomplete last entry at 0 x2"));
}

TEST_P(ExportEntryStreamTest, anEntryMayExceedTheWindow) {
  const std::string start =
      "__REALTIME_TIMESTAMP=3\nT=first\n" + binary("MESSAGE", std::string(400'000, 'm'));
  append(start);
  EXPECT_THAT(readAll(), IsEmpty());
  append("\n");
  EXPECT_THAT(readAll(), ElementsAre("3: T=first"));
}

TEST_P(ExportEntryStreamTest, wrongLengthsCostLinearTime) {
  std::string text;
  for (int i = 0; i < 50'000; ++i) text += binary("A", "", 300'007) + "\n";
  for (int i = 0; i < 20'000; ++i) text += kGood;
  append(text);
  EXPECT_GT(readAll().size(), 5'000u);
  ASSERT_EQ(report.problems.all().size(), 1u);
  EXPECT_EQ(report.problems.all()[0].words, "value of another length than stated");
  EXPECT_LT(report.problems.all()[0].count, 50u);
}

TEST_P(ExportEntryStreamTest, unfinishedBadDataCountsOnce) {
  append("garbage\nmore");
  EXPECT_THAT(readAll(), IsEmpty());
  append(" garbage\n\n");
  append(kGood);
  EXPECT_THAT(readAll(), ElementsAre("7: T=good"));
  EXPECT_THAT(problems(), ElementsAre("line that is no field at 0 x1"));
}

TEST_P(ExportEntryStreamTest, aStopEndsIt) {
  append(kGood);
  append(kGood);
  ASSERT_TRUE(next());
  stop = true;
  EXPECT_FALSE(next());
  EXPECT_THAT(problems(), IsEmpty());
  // An entry may be as long as the file.
  stop = false;
  tokenizer_.stop = &stop;
  std::string endless = "__REALTIME_TIMESTAMP=1\nSTOP=now\n";
  for (int i = 0; i < 1000; ++i) endless += "MESSAGE=x\n";
  append(endless + "\n");
  while (next()) continue;
  EXPECT_LT(tokenizer_.asked, 10u);
}

// Many streams of one store read the same file: an entry of a megabyte, then a usual one.
class ExportResourcesTest : public ::testing::Test {
 protected:
  ExportResourcesTest() {
    std::string text = "__REALTIME_TIMESTAMP=1\n";
    for (int i = 0; i < 250; ++i) text += "T=" + std::string(4000, 'x') + "\n";
    text += "\n" + std::string(kGood);
    EXPECT_EQ(::write(file_, text.data(), text.size()), ssize_t(text.size()));
  }
  ~ExportResourcesTest() override { ::close(file_); }

  ExportEntryStream& addStream() {
    const std::string path = "/proc/self/fd/" + std::to_string(file_);
    return *streams_.emplace_back(std::make_unique<ExportEntryStream>(
        ::open(path.c_str(), O_RDONLY), resources_, tokenizer_, stop_, report_));
  }

  const int file_ = ::memfd_create("large", 0);
  RecordingTokenizer tokenizer_;
  StopFlag stop_ = false;
  FileReport report_;
  WindowBudget windows_;
  ExportReadResources resources_{windows_};
  std::vector<std::unique_ptr<ExportEntryStream>> streams_;
};

TEST_F(ExportResourcesTest, whatAllStreamsKeepIsBounded) {
  size_t large = 0;
  for (int i = 0; i < 20; ++i) {
    ExportEntryStream& stream = addStream();
    ASSERT_TRUE(stream.next());
    large += stream.header().realtime == 1;
    EXPECT_LE(resources_.bytesKept, ExportEntryStream::kMaxBytesKeptByAll);
  }
  EXPECT_EQ(large, 4u);
  EXPECT_EQ(report_.problems.all().at(0).count, 16u);
  streams_.clear();
  EXPECT_EQ(resources_.bytesKept, 0u);
}

TEST_F(ExportResourcesTest, aLargeEntryGivesItsMemoryBack) {
  const auto taken = [] { return ::mallinfo2().uordblks + ::mallinfo2().hblkhd; };
  const size_t before = taken();
  for (int i = 0; i < 40; ++i) {
    ExportEntryStream& stream = addStream();
    ASSERT_TRUE(stream.next() && stream.header().realtime == 1);
    ASSERT_TRUE(stream.next() && stream.header().realtime == 7);
  }
  EXPECT_LT(taken(), before + 40 * WindowBudget::kLargest + (size_t{4} << 20));
}

TEST(ExportPipeTest, aPipeIsReadToItsEnd) {
  int ends[2];
  ASSERT_EQ(::pipe(ends), 0);
  const std::string text = std::string(kGood) + "__REALTIME_TIMESTAMP=8\n";
  ASSERT_EQ(::write(ends[1], text.data(), text.size()), ssize_t(text.size()));
  ::close(ends[1]);
  RecordingTokenizer tokenizer;
  StopFlag stop = false;
  FileReport report;
  WindowBudget windows;
  ExportReadResources resources{windows};
  ExportEntryStream stream(ends[0], resources, tokenizer, stop, report);
  EXPECT_TRUE(stream.next());
  EXPECT_FALSE(stream.next());
  ASSERT_EQ(report.problems.all().size(), 1u);
  EXPECT_EQ(report.problems.all()[0].words, "incomplete last entry");
}

TEST(EntryCursorTest, readsWhatItWritesAndNothingElse) {
  EntryHeader header;
  header.sequenceId = {1, 2, 3};
  header.bootId = {0xff};
  header.sequenceNumber = 10;
  header.monotonic = UINT64_MAX;
  header.contentHash = 0xabc;
  const std::string cursor = cursorOf(header);
  ASSERT_TRUE(parseCursor(cursor));
  EXPECT_EQ(cursorOf(*parseCursor(cursor)), cursor);
  for (size_t length = 0; length < cursor.size() - 2; ++length) {
    EXPECT_FALSE(parseCursor(cursor.substr(0, length))) << length;
  }
  EXPECT_FALSE(parseCursor(cursor + ";y=1"));
  EXPECT_FALSE(parseCursor("i=1;" + cursor));
  EXPECT_TRUE(parseId128("00010203-0405-0607-0809-0a0b0c0d0e0f"));
  EXPECT_FALSE(parseId128("000102030405060708090a0b0c0d0e0g"));
  EXPECT_FALSE(parseId128("000102030405060708090a0b0c0d0e0f00"));
}

}  // namespace
}  // namespace tessel
