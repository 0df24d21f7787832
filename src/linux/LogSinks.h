// Where log lines go: the journal, or a terminal's lines on standard error.
//
// Both sinks may be used from any thread and keep no state, so they are made once and never
// destroyed.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "linux/LaunchConfiguration.h"
#include "platform/Log.h"

namespace tessel {

// One line per message: "error: text" or "debug: text". One line feed at the end of the text is the
// line's own; further lines of a text are indented, and control characters are written as \xNN.
class StderrLog final : public LogSink {
 public:
  // Writes to `fd`, which is not owned.
  explicit StderrLog(int fd = 2) : fd_(fd) {}
  void write(LogLevel level, std::string_view subsystem, std::string_view category,
             std::string_view text) override;

 private:
  const int fd_;
};

// One journal entry per message, its text as it stands. What the journal does not take goes to
// standard error.
class JournalLog final : public LogSink {
 public:
  void write(LogLevel level, std::string_view subsystem, std::string_view category,
             std::string_view text) override;

 private:
  StderrLog fallback_;
};

// The fields of one message's journal entry, each NAME=value. None is a trace-point field.
std::vector<std::string> journalFields(LogLevel level, std::string_view subsystem,
                                       std::string_view category, std::string_view text);

// The sink for `destination`; without one, the journal where its socket exists, else standard
// error.
std::unique_ptr<LogSink> makeLogSink(
    std::optional<LogDestination> destination,
    const std::string& journalSocket = "/run/systemd/journal/socket");

}  // namespace tessel
