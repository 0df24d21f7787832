// The journal and standard error as log sinks.

#define SD_JOURNAL_SUPPRESS_LOCATION  // the place of the call says nothing: all lines pass here

#include "linux/LogSinks.h"

#include <sys/stat.h>
#include <sys/uio.h>
#include <systemd/sd-journal.h>

#include "os/Files.h"
#include "platform/PlainText.h"

namespace tessel {

void StderrLog::write(LogLevel level, std::string_view /*subsystem*/, std::string_view /*category*/,
                      std::string_view text) {
  if (text.ends_with('\n')) text.remove_suffix(1);
  std::string line = level == LogLevel::error ? "error: " : "debug: ";
  line += plainText(text, "\n    ");
  line += '\n';
  writeAll(fd_, line);
}

std::vector<std::string> journalFields(LogLevel level, std::string_view subsystem,
                                       std::string_view category, std::string_view text) {
  // Syslog's numbers for error and debug.
  const char* priority = level == LogLevel::error ? "3" : "7";
  std::vector<std::string> fields{
      "MESSAGE=" + std::string(text), "PRIORITY=" + std::string(priority),
      "LOG_SUBSYSTEM=" + std::string(subsystem), "LOG_CATEGORY=" + std::string(category),
      "SYSLOG_IDENTIFIER=tessel_reporter"};
  if (const auto id = messageIdOf(text)) fields.push_back("MESSAGE_ID=" + std::string(*id));
  return fields;
}

void JournalLog::write(LogLevel level, std::string_view subsystem, std::string_view category,
                       std::string_view text) {
  std::vector<std::string> fields = journalFields(level, subsystem, category, text);
  std::vector<iovec> parts;
  parts.reserve(fields.size());
  for (std::string& field : fields) parts.push_back({field.data(), field.size()});
  if (sd_journal_sendv(parts.data(), static_cast<int>(parts.size())) < 0) {
    fallback_.write(level, subsystem, category, text);
  }
}

std::unique_ptr<LogSink> makeLogSink(std::optional<LogDestination> destination,
                                     const std::string& journalSocket) {
  struct stat facts {};
  const bool hasJournal = ::stat(journalSocket.c_str(), &facts) == 0 && S_ISSOCK(facts.st_mode);
  const LogDestination automatic =
      hasJournal ? LogDestination::journal : LogDestination::standardError;
  if (destination.value_or(automatic) == LogDestination::journal)
    return std::make_unique<JournalLog>();
  return std::make_unique<StderrLog>();
}

}  // namespace tessel
