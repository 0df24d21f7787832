// The journal and standard error as log sinks.
//
// A log line must arrive whatever else fails, so neither sink keeps a file, a lock or a buffer. A
// message that cannot be sent to the journal (nobody listens on its socket, for example) goes to
// standard error, which the service manager keeps as well. If that fails too, the message is lost:
// a run is worth more than its log.

#define SD_JOURNAL_SUPPRESS_LOCATION  // every line is sent from this file

#include "linux/LogSinks.h"

#include <sys/stat.h>
#include <sys/uio.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// The lines that packaging/systemd/tessel.catalog explains, by their beginnings. Their entries
// carry the identifier, by which `journalctl -x` finds the explanation. A test of the packages
// compares this table with the catalog.
constexpr struct {
  std::string_view beginning;
  std::string_view id;  // 32 hexadecimal digits
} kCatalogedMessages[] = {
    {"Bailing due to cookie file", "88bc816f3d5048b0ace67b9e33914435"},
    {"Could not clear cookie file: ", "9cb66619cda440b487900bffc379e114"},
    {"Failed to process tessel data due to error: ", "a945202e0c6242889cfdf3bf6a9058b7"},
    {"Not reporting ", "aab21dd8ab154e9e9b6bcf90786745c9"},
    {"The configuration cannot be looked at: ", "f1c07d1b6f4f4c0c9f2bd3e0a7b5e894"},
    {"Trying to stop in-flight reporting work.", "028e77c9a30243d590fb466bdd747234"},
    {"Done processing ", "23f0765b490247bfb6e565c7b662573f"},
    {"The run failed: ", "b7de085a430a4ebb9409220443622161"},
    {"The run read nothing, because an earlier run died", "f0b4d753248145ed88d190ca9b5b247d"},
    {"The run was cut short", "b391e7c91d614a409721ecdf35769ea9"},
    {"The run marker could not be removed", "283b182eed6347249d31744128c97432"},
    {"The spool refused rows of the run: ", "3d540be105e34511a8b7c59030803b88"},
    {"The books of the run do not balance: ", "2180da59c80c4f7fba8a7a4b47b8ae27"},
    {"Rows of the spool expired: ", "383c13e7c86348e6b4d033047c7aba86"},
    {"A damaged spool was set aside: ", "2f24059a99aa469594a71fc37ad366be"},
    {"Files of the trace store were not read: ", "e51135e212e748588088feaa13b643c7"},
    {"The trace store is damaged: ", "06d3ff7cb7194f92b1f79ebf73be148c"},
    {"The journal daemon dropped entries: ", "4bd946453b0c49acbcadbee2afe8b087"},
    {"Programs lost trace points before the journal: ", "7861efa4964e40e2b3254afdc679c75d"},
    {"Entries are in no file of the trace store: ", "b1c6565b3ac74fb59a9d2fd41894851c"},
    {"Trace points were malformed: ", "aa58f7272a6b43bd9e8469473d0cd602"},
    {"Writers had more than their share, ", "c406cfaadd0b41668e8fdd01c190de7c"},
    {"A file in the state directory is not used: ", "dc9f4449558a4b44b8db8d735db6a79b"},
    {"The record of the run is not written: ", "5ec5b861dea7400ab6f514dfd29986f8"},
    {"The run is put off: ", "5404ba8a07bf4b149c0e56928bae46cd"},
    {"The run is stopped early: ", "68f8b03461d34a78a9b19699e316cfc7"},
};

struct LevelNames {
  std::string_view onStderr;
  char priority;  // syslog's number
};

constexpr LevelNames namesOf(LogLevel level) {
  switch (level) {
    case LogLevel::error:
      return {"error: ", '3'};
    case LogLevel::warning:
      return {"warning: ", '4'};
    case LogLevel::debug:
      break;
  }
  return {"debug: ", '7'};
}

bool isSocket(const std::string& path) {
  struct stat facts {};
  return ::stat(path.c_str(), &facts) == 0 && S_ISSOCK(facts.st_mode);
}

}  // namespace

StderrLog::StderrLog(std::string_view program, int fd)
    : lineStart_(program.empty() ? "" : std::string(program) + ": "), fd_(fd) {}

void StderrLog::write(LogLevel level, std::string_view /*subsystem*/, std::string_view /*category*/,
                      std::string_view text) {
  if (text.ends_with('\n')) text.remove_suffix(1);
  std::string line = lineStart_ + std::string(namesOf(level).onStderr);
  line += plainText(text, "\n    ");
  line += '\n';
  // One write for the whole line, so that the lines of several threads do not mix.
  writeAll(fd_, line);
}

std::vector<std::string> journalFields(LogLevel level, std::string_view subsystem,
                                       std::string_view category, std::string_view text) {
  std::vector<std::string> fields{
      "MESSAGE=" + std::string(text), std::string("PRIORITY=") + namesOf(level).priority,
      "LOG_SUBSYSTEM=" + std::string(subsystem), "LOG_CATEGORY=" + std::string(category),
      "SYSLOG_IDENTIFIER=" + std::string(category)};
  for (const auto& message : kCatalogedMessages) {
    if (!text.starts_with(message.beginning)) continue;
    fields.push_back("MESSAGE_ID=" + std::string(message.id));
    break;
  }
  return fields;
}

void JournalLog::write(LogLevel level, std::string_view subsystem, std::string_view category,
                       std::string_view text) {
  // libsystemd answers success where no socket exists, so that programs run without a journal. The
  // line would be lost, so we look first. A look costs a microsecond, and the line ten.
  if (!isSocket(socket_)) return fallback_.write(level, subsystem, category, text);
  std::vector<std::string> fields = journalFields(level, subsystem, category, text);
  std::vector<iovec> parts;
  parts.reserve(fields.size());
  for (std::string& field : fields) parts.push_back({field.data(), field.size()});
  // A field is sent with its length, so a text with line feeds stays one entry.
  if (sd_journal_sendv(parts.data(), static_cast<int>(parts.size())) < 0) {
    fallback_.write(level, subsystem, category, text);
  }
}

std::unique_ptr<LogSink> makeLogSink(std::optional<LogDestination> destination,
                                     std::string_view program, const std::string& journalSocket) {
  const LogDestination automatic =
      isSocket(journalSocket) ? LogDestination::journal : LogDestination::standardError;
  if (destination.value_or(automatic) == LogDestination::journal)
    return std::make_unique<JournalLog>(program, STDERR_FILENO, journalSocket);
  return std::make_unique<StderrLog>(program);
}

}  // namespace tessel
