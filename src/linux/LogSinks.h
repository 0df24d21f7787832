// Where log lines go: the journal, or standard error.
//
// Both sinks may be used from any thread and keep no state that changes. They are made once and
// never destroyed, because a detached thread may log until the very end of the process.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "linux/LaunchConfiguration.h"
#include "platform/Log.h"

namespace tessel {

inline constexpr char kJournalSocket[] = "/run/systemd/journal/socket";

// Writes one line per message: "error: text", "warning: text" or "debug: text". A line feed that
// ends the text ends the line. The text's further lines are indented and its control characters
// become \xNN, so that text from outside can neither start a line of its own nor command a
// terminal.
class StderrLog final : public LogSink {
 public:
  // `program` and ": " stand before each line, unless it is empty. `fd` is not owned.
  explicit StderrLog(std::string_view program = {}, int fd = 2);
  void write(LogLevel level, std::string_view subsystem, std::string_view category,
             std::string_view text) override;

 private:
  const std::string lineStart_;
  const int fd_;
};

// Writes one journal entry per message and leaves the text as it is. A message that cannot be sent
// goes to standard error.
class JournalLog final : public LogSink {
 public:
  // `fd` is the standard error of the fallback, and is not owned. `socket` is only looked at:
  // messages always go to the machine's journal.
  explicit JournalLog(std::string_view program = {}, int fd = 2,
                      std::string socket = kJournalSocket)
      : fallback_(program, fd), socket_(std::move(socket)) {}
  void write(LogLevel level, std::string_view subsystem, std::string_view category,
             std::string_view text) override;

 private:
  StderrLog fallback_;
  const std::string socket_;
};

// The fields of one message's journal entry, each NAME=value. The category is the identifier that
// `journalctl -t` looks for. None of the fields belongs to a trace point, so a log line is never
// read as a trace point.
std::vector<std::string> journalFields(LogLevel level, std::string_view subsystem,
                                       std::string_view category, std::string_view text);

// Makes the sink for `destination`. If that is absent, the sink is the journal if its socket
// exists, and standard error otherwise. See StderrLog for `program`.
std::unique_ptr<LogSink> makeLogSink(std::optional<LogDestination> destination,
                                     std::string_view program = {},
                                     const std::string& journalSocket = kJournalSocket);

}  // namespace tessel
