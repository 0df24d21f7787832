// What the commands of tesselctl share: how one is added, what it is called with, the options for
// reading a trace store, and how it ends.
//
// One thread at a time.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

#include "linux/LaunchConfiguration.h"
#include "platform/Error.h"
#include "tesselctl/judging/Judge.h"
#include "tesselctl/reading/DryRun.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

// What tesselctl exits with.
enum ExitStatus : int {
  kDone = 0,      // the question was answered, the thing was done
  kBad = 1,       // the answer is bad news, or it could not be done
  kUsage = 2,     // the command line or the environment makes no sense
  kNoAccess = 4,  // this user may not read or write what is needed
};

// One call of the program.
struct Invocation {
  // The words behind "--" on the command line; absent without a "--".
  std::optional<std::vector<std::string>> command;
  // Set by the command that was called.
  int status = kDone;
};

// What surrounds a command when it begins.
struct Surroundings {
  LaunchConfiguration launch;  // as the service would find it in the same environment
  Date now{};
  Terminal terminal;  // behind standard output
};
// Absent where a variable of the environment makes no sense. A line on stderr names it by then.
std::optional<Surroundings> lookAround();

// --- Adding a command.

// Lets a call of `command` run `run` and keep its exit status. `options` live as long as the
// command; `invocation` must outlive it.
template <typename Options>
void setAction(CLI::App& command, Invocation& invocation, std::shared_ptr<Options> options,
               int (*run)(const Options&, const Surroundings&)) {
  command.callback([&invocation, options = std::move(options), run] {
    const auto surroundings = lookAround();
    invocation.status = surroundings ? run(*options, *surroundings) : kUsage;
  });
}

struct CommandText {
  const char* name;
  const char* description;
  std::string footer;  // notes and examples below the options
};

// Adds a subcommand to `app` that runs `run`. Its options are read into what is answered.
template <typename Options>
struct AddedCommand {
  CLI::App& command;
  Options& options;
};
template <typename Options>
AddedCommand<Options> addCommand(CLI::App& app, Invocation& invocation, const CommandText& text,
                                 int (*run)(const Options&, const Surroundings&)) {
  auto options = std::make_shared<Options>();
  CLI::App* command = app.add_subcommand(text.name, text.description);
  command->footer(text.footer);
  setAction(*command, invocation, options, run);
  return {*command, *options};
}

// --- Reading a trace store.

// As given on the command line.
struct ReadingOptions {
  std::optional<std::string> store;
  PeriodArguments period;
  std::optional<std::string> platform;
  bool internal = false;  // --internal
  bool external = false;  // --no-internal
};

// Adds --store, --since, --until and --last.
void addPeriodOptions(CLI::App& command, ReadingOptions& options);
// Adds --platform, --internal and --no-internal.
void addJudgeOptions(CLI::App& command, ReadingOptions& options);
// Adds an option that takes a pattern and may be repeated.
CLI::Option* addPatterns(CLI::App& command, const char* name, std::vector<std::string>& patterns,
                         const char* help);
// Whether `text` fits one of the patterns, which may hold * ? and [...]. It does where there are
// none.
bool fitsOne(const std::vector<std::string>& patterns, const std::string& text);

// What the options mean. The environment stands in for what is not given.
struct Reading {
  std::optional<std::string> store;  // absent: the machine's own journal
  Period period;
  JudgedMachine machine;
};
// Absent where an option makes no sense. A line on stderr names the option and its value by then.
std::optional<Reading> readingOf(const ReadingOptions& options, const Surroundings& surroundings);

// Reads the period, with a progress bar on standard error. The bar moves from `begin` to `end`,
// which are parts of 1. `shown` is false where the terminal gets other lines meanwhile.
std::optional<PlatformError> readWithProgress(DryRun& run, const Period& period, bool shown = true,
                                              double begin = 0, double end = 1);

// Absent where no platform is called that.
std::optional<TesselReporterPlatform> platformNamed(const std::string& name);

// --- Ending a command. Each says why on stderr, fit for a terminal, and answers the exit status.

// "tesselctl: message".
int fail(ExitStatus status, const std::string& message);
// A trace store cannot be read.
int failToRead(const PlatformError& error, const std::optional<std::string>& store);
// A file cannot be written.
int failToWrite(const PlatformError& error);
// A store was read, but some files of it were not: whoever trusts the figures must know. kDone
// where all were read.
int warnOfUnreadFiles(const StoreReport& report, const std::optional<std::string>& store);

// --- The commands, each in a file of its own. `app` and `invocation` live until the program ends.

void addRecordCommand(CLI::App& app, Invocation& invocation);
void addExplainCommand(CLI::App& app, Invocation& invocation);
void addCompareCommand(CLI::App& app, Invocation& invocation);
void addEventsCommand(CLI::App& app, Invocation& invocation);
void addStatusCommand(CLI::App& app, Invocation& invocation);
void addDeferCommand(CLI::App& app, Invocation& invocation);
void addTaskingCommand(CLI::App& app, Invocation& invocation);
void addReportCommand(CLI::App& app, Invocation& invocation);

}  // namespace tessel::ctl
