// Where log lines go: the journal, or a terminal's lines on standard error.
//
// Both sinks may be used from any thread and keep no state, so they are made once and never
// destroyed.

#pragma once

#include <array>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "linux/LaunchConfiguration.h"
#include "platform/Log.h"

namespace tessel {

// Where log lines go: the journal, or a terminal's lines on standard error.
//
// Both sinks may be used from any thread and keep no state, so they are made once and never
// destroyed.

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

// Which log lines the journal can explain: their identifiers in the message catalog.

struct CatalogedMessage {
  std::string_view beginning;  // of the line; the first that fits decides
  std::string_view id;         // 32 hexadecimal digits
};

// packaging/systemd/tessel.catalog has an entry for each.
inline constexpr std::array<CatalogedMessage, 6> kCatalogedMessages{{
    {"Bailing due to cookie file", "88bc816f3d5048b0ace67b9e33914435"},
    {"Could not clear cookie file: ", "9cb66619cda440b487900bffc379e114"},
    {"Failed to process tessel data due to error: ", "a945202e0c6242889cfdf3bf6a9058b7"},
    {"Not reporting ", "aab21dd8ab154e9e9b6bcf90786745c9"},
    {"Trying to stop in-flight reporting work.", "028e77c9a30243d590fb466bdd747234"},
    {"Done processing ", "23f0765b490247bfb6e565c7b662573f"},
}};

constexpr std::optional<std::string_view> messageIdOf(std::string_view text) {
  for (const CatalogedMessage& message : kCatalogedMessages) {
    if (text.starts_with(message.beginning)) return message.id;
  }
  return std::nullopt;
}

}  // namespace tessel
