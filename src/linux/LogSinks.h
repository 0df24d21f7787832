// Where log lines go: the journal, or standard error.
//
// Both sinks may be used from any thread and keep no state that changes. They are made once and
// never destroyed, because a detached thread may log until the very end of the process.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "linux/LaunchConfiguration.h"
#include "platform/Log.h"

namespace tessel {

// Writes one line per message: "error: text" or "debug: text". A line feed that ends the text ends
// the line. The text's further lines are indented and its control characters become \xNN, so that
// text from outside can neither start a line of its own nor command a terminal.
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
// goes to standard error. If the journal's socket does not exist at all, libsystemd reports success
// and the message is lost; makeLogSink() chooses this sink then only if it is told to.
class JournalLog final : public LogSink {
 public:
  explicit JournalLog(std::string_view program = {}) : fallback_(program) {}
  void write(LogLevel level, std::string_view subsystem, std::string_view category,
             std::string_view text) override;

 private:
  StderrLog fallback_;
};

// The fields of one message's journal entry, each NAME=value. The category is the identifier that
// `journalctl -t` looks for. None of the fields belongs to a trace point, so a log line is never
// read as a trace point.
std::vector<std::string> journalFields(LogLevel level, std::string_view subsystem,
                                       std::string_view category, std::string_view text);

// Makes the sink for `destination`. If that is absent, the sink is the journal if its socket
// exists, and standard error otherwise. See StderrLog for `program`.
std::unique_ptr<LogSink> makeLogSink(
    std::optional<LogDestination> destination, std::string_view program = {},
    const std::string& journalSocket = "/run/systemd/journal/socket");

}  // namespace tessel
