// The commands of tesselctl: each adds itself to the command line in a file of its own.

#pragma once

#include <optional>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

namespace tessel::ctl {

// What tesselctl exits with.
enum ExitStatus : int {
  kDone = 0,      // the question was answered, the thing was done
  kBad = 1,       // the answer is bad news
  kUsage = 2,     // the command line makes no sense
  kNoAccess = 4,  // something could not be reached, read or written
};

// One call of the program.
struct Invocation {
  // What stands behind "--" on the command line; absent without one.
  std::optional<std::vector<std::string>> command;
  // What to exit with; set by the command that was called.
  int status = kDone;
};

// Says `message` on stderr, as "tesselctl: message", fit for a terminal, and answers `status`.
int fail(ExitStatus status, const std::string& message);

// Each adds its subcommand. `app` and `invocation` live until the program ends.
void addRecordCommand(CLI::App& app, Invocation& invocation);
void addExplainCommand(CLI::App& app, Invocation& invocation);
void addCompareCommand(CLI::App& app, Invocation& invocation);
void addEventsCommand(CLI::App& app, Invocation& invocation);
void addStatusCommand(CLI::App& app, Invocation& invocation);
void addDeferCommand(CLI::App& app, Invocation& invocation);
void addTaskingCommand(CLI::App& app, Invocation& invocation);
void addReportCommand(CLI::App& app, Invocation& invocation);

}  // namespace tessel::ctl
