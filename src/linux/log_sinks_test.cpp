// Lines on standard error and fields of journal entries.

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>

#include "linux/LogSinks.h"
#include "os/UniqueFd.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

std::string linesOf(LogLevel level, std::string_view text, std::string_view program = {}) {
  const TemporaryDirectory directory;
  const UniqueFd file(::open(directory.path("log").c_str(), O_WRONLY | O_CREAT, 0600));
  StderrLog(program, file.get()).write(level, "com.vantor.TesselSupport", "category", text);
  return directory.read("log");
}

TEST(StderrLogTest, ForeignTextCannotStartALine) {
  const struct {
    std::string_view text;
    const char* line;
  } kCases[] = {
      {"Checking in\n", "debug: Checking in\n"},
      {"", "debug: \n"},
      {"Summary:\nerror: forged", "debug: Summary:\n    error: forged\n"},
      {"a\n\n", "debug: a\n    \n"},
      {"\x1b[31mred\r\x7f", "debug: \\x1b[31mred\\x0d\\x7f\n"},
      {std::string_view("nul\0.", 5), "debug: nul\\x00.\n"},
      {"a\tb \xc3\xa9 \xf0\x9f\x98\x80", "debug: a\tb \xc3\xa9 \xf0\x9f\x98\x80\n"},
      {"C1 \xc2\x9b is CSI", "debug: C1 \\xc2\\x9b is CSI\n"},
      {"broken \xe2\x82 \xff", "debug: broken \\xe2\\x82 \\xff\n"},
      {"cut \xf0\x9f", "debug: cut \\xf0\\x9f\n"},
  };
  for (const auto& [text, line] : kCases) EXPECT_EQ(linesOf(LogLevel::debug, text), line);
  EXPECT_EQ(linesOf(LogLevel::error, "Could not"), "error: Could not\n");
  EXPECT_EQ(linesOf(LogLevel::warning, "Lost"), "warning: Lost\n");
  EXPECT_EQ(linesOf(LogLevel::error, "a\nb", "program"), "program: error: a\n    b\n");
}

TEST(JournalLogTest, AnEntryIsNeverATracePoint) {
  const auto fields = journalFields(LogLevel::debug, "com.vantor.TesselSupport", "tessel_reporter",
                                    "Checking in\nTESSEL_KIND=event\n");
  EXPECT_THAT(fields, ::testing::UnorderedElementsAre(
                          "MESSAGE=Checking in\nTESSEL_KIND=event\n", "PRIORITY=7",
                          "LOG_SUBSYSTEM=com.vantor.TesselSupport", "LOG_CATEGORY=tessel_reporter",
                          "SYSLOG_IDENTIFIER=tessel_reporter"));
  EXPECT_THAT(journalFields(LogLevel::warning, "", "", ""), ::testing::Contains("PRIORITY=4"));
  EXPECT_THAT(journalFields(LogLevel::error, "", "statora_forwarder", ""),
              ::testing::IsSupersetOf({"PRIORITY=3", "SYSLOG_IDENTIFIER=statora_forwarder"}));
  EXPECT_THAT(journalFields(LogLevel::debug, "", "", "Bailing due to cookie file"),
              ::testing::Contains("MESSAGE_ID=88bc816f3d5048b0ace67b9e33914435"));
}

bool isJournal(const std::unique_ptr<LogSink>& sink) {
  return dynamic_cast<JournalLog*>(sink.get()) != nullptr;
}

TEST(MakeLogSinkTest, TheJournalIsUsedWhereItsSocketIs) {
  const TemporaryDirectory directory;
  const std::string path = directory.path("socket");
  EXPECT_FALSE(isJournal(makeLogSink({}, "", path)));
  EXPECT_FALSE(isJournal(makeLogSink({}, "", directory.write("file", ""))));

  const UniqueFd socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  ASSERT_LT(path.size(), sizeof address.sun_path);
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  ASSERT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  EXPECT_TRUE(isJournal(makeLogSink({}, "", path)));
  EXPECT_FALSE(isJournal(makeLogSink(LogDestination::standardError, "", path)));
  EXPECT_TRUE(isJournal(makeLogSink(LogDestination::journal, "", directory.path("none"))));
}

}  // namespace
}  // namespace tessel
