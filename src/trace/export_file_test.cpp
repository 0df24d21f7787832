// What is appended is what is read back, by whoever writes and however many.

#include "journal/EntryRecording.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <fstream>
#include <thread>

#include "journal/ExportEntryStream.h"
#include "os/testing/TemporaryDirectory.h"
#include "trace/TracePointTable.h"

namespace tessel {
namespace {

class ExportFileTest : public ::testing::Test {
 protected:
  std::string path() const { return directory.path("tessel.export"); }
  bool append(const std::string& name) {
    return !appendToExportFile(directory.path(), origin, {{"TESSEL_NAME", name}});
  }
  // The names in the file, in order; checks that the entries count up without a gap.
  std::vector<std::string> names() {
    std::vector<std::string> all;
    TracePointTable table;
    StopFlag stop = false;
    WindowBudget windows;
    ExportReadResources resources{windows};
    ExportEntryStream stream(::open(path().c_str(), O_RDONLY), resources, table, stop, report);
    uint64_t expected = 1;
    while (stream.next()) {
      const Entry entry = stream.entry();
      EXPECT_EQ(entry.header.sequenceNumber, expected++);
      EXPECT_EQ(entry.header.realtime, origin.realtime);
      for (const FieldToken token : entry.tokens) {
        if (table.kind(token) == FieldKind::name) all.emplace_back(table.text(token).text());
      }
    }
    return all;
  }

  testing::TemporaryDirectory directory;
  RecordOrigin origin = currentOrigin();
  FileReport report;
};

TEST_F(ExportFileTest, readsBackWhatWasAppended) {
  const std::vector<std::string> values = {
      "plain",        "",     "two\nlines",          "\n\n__CURSOR=s=0;i=9\n\n",
      "\x01\x1b[31m", "grün", std::string(4096, 'x')};
  for (const std::string& value : values) ASSERT_TRUE(append(value));
  EXPECT_EQ(names(), values);
  EXPECT_TRUE(report.problems.empty());
}

TEST_F(ExportFileTest, writersDoNotMixTheirEntries) {
  constexpr int kWriters = 4;
  constexpr int kEach = 50;
  std::vector<std::thread> writers;
  writers.reserve(kWriters);
  for (int writer = 0; writer < kWriters; ++writer) {
    writers.emplace_back([this, writer] {
      for (int i = 0; i < kEach; ++i)
        append(std::to_string(writer) + "\n" + std::string(3000, 'x'));
    });
  }
  for (std::thread& writer : writers) writer.join();
  EXPECT_EQ(names().size(), size_t{kWriters} * kEach);
  EXPECT_TRUE(report.problems.empty());
}

TEST_F(ExportFileTest, halfAnEntryCostsNoOther) {
  ASSERT_TRUE(append("first"));
  std::ofstream(path(), std::ios::app) << "__REALTIME_TIMESTAMP=1\nTESSEL_NA";
  ASSERT_TRUE(append("second"));
  EXPECT_EQ(names(), (std::vector<std::string>{"first", "second"}));
  ASSERT_EQ(report.problems.all().size(), 1u);
  EXPECT_EQ(report.problems.all()[0].count, 1u);
}

TEST_F(ExportFileTest, anErrorNamesThePathAndTheReason) {
  const auto error = appendToExportFile("/proc/nowhere", origin, {});
  ASSERT_TRUE(error);
  EXPECT_NE(error->words.find("/proc/nowhere/tessel.export: No such file"), std::string::npos);
}

}  // namespace
}  // namespace tessel
