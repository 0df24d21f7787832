// The commands of tesselctl share this: a way to add a command, the facts that it starts with, the
// options for reading a trace store, and the ways to end with an exit status.
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
  std::string colour = "auto";  // --color
};

// What surrounds a command when it begins.
struct Surroundings {
  LaunchConfiguration launch;  // as the service would find it in the same environment
  Date now{};
  Terminal terminal;  // behind standard output
};
// Reads the environment. If a variable makes no sense, prints its name on stderr and returns
// nothing.
std::optional<Surroundings> lookAround(const Invocation& invocation);

// Says on stderr that $TZ names no zone, if so; local time is UTC from then on. Each command that
// reads or shows dates begins with it.
void checkZone();

// --- Adding a command.

// Makes `command` call `run` and store its exit status in `invocation`. `command` shares the
// ownership of `options`. `invocation` must outlive `command`.
template <typename Options>
void setAction(CLI::App& command, Invocation& invocation, std::shared_ptr<Options> options,
               int (*run)(const Options&, const Surroundings&)) {
  command.callback([&invocation, options = std::move(options), run] {
    const auto surroundings = lookAround(invocation);
    invocation.status = surroundings ? run(*options, *surroundings) : kUsage;
  });
}

struct CommandText {
  const char* name;
  const char* description;
  std::string footer;  // notes and examples below the options
};

// --- What --help tells below the options: notes, then the environment, then examples. A help is at
// most 80 columns wide.

// Sets how the help of `app`, and of commands that are added later, looks.
void formatHelp(CLI::App& app);
// A paragraph, with the empty line behind it.
std::string helpText(std::string_view text);
// Names and what they mean, in two columns, with the empty line behind them.
struct HelpRow {
  std::string name;
  std::string meaning;
};
std::string helpTable(std::string_view title, const std::vector<HelpRow>& rows);
// The variables that the command heeds. REQUIRES: Help.cpp knows them.
std::string helpEnvironment(std::initializer_list<std::string_view> names);

// Adds --color. `invocation` must outlive `app`.
void addColourOption(CLI::App& app, Invocation& invocation);

// Refuses each value of the option that is not one of `words`, and names them. The completion
// offers them.
CLI::Option* takesOneOf(CLI::Option* option, const std::vector<std::string>& words);
// Refuses what is no whole number of `unit`, such as "rows", between the two.
CLI::Option* takesWhole(CLI::Option* option, uint64_t least, uint64_t most,
                        const std::string& unit);
// Lets the completion offer `words`. Other values are taken as well.
CLI::Option* suggests(CLI::Option* option, const std::vector<std::string>& words);
// Lets the completion offer the names of files, and refuses an empty value.
CLI::Option* suggestsFiles(CLI::Option* option);
// The options and arguments that the parser takes behind `command`: its own, and options of the
// commands around it as long as one lets them fall through to the next.
std::vector<const CLI::Option*> optionsOf(const CLI::App& command);
// What the option takes, as the completion offers it; empty where it may be anything.
std::vector<std::string> valuesOf(const CLI::Option& option);
// Makes the parser refuse --json=no, which it would take for --json.
void refuseValuesOfFlags(CLI::App& app);
// What the completion prints for the names of files.
inline constexpr std::string_view kFiles = "FILES";
// Prints what may stand in place of the last of `words`, which are the arguments of a command line
// up to the cursor: a word a line, or kFiles alone. Returns the status.
int complete(CLI::App& app, const std::vector<std::string>& words);

// A subcommand, and the options that the parser fills in. The subcommand owns the options.
template <typename Options>
struct AddedCommand {
  CLI::App& command;
  Options& options;
};
// Adds a subcommand that calls `run` to `app`. `app` owns it.
template <typename Options>
AddedCommand<Options> addCommand(CLI::App& app, Invocation& invocation, const CommandText& text,
                                 int (*run)(const Options&, const Surroundings&)) {
  auto options = std::make_shared<Options>();
  CLI::App* command = app.add_subcommand(text.name, text.description);
  command->footer(text.footer);
  addColourOption(*command, invocation);
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

// The meaning of the options. The environment supplies the values of options that are not given.
struct Reading {
  std::optional<std::string> store;  // absent: the machine's own journal
  Period period;
  JudgedMachine machine;
};
// If an option makes no sense, prints the option and its value on stderr and returns nothing.
std::optional<Reading> readingOf(const ReadingOptions& options, const Surroundings& surroundings);

// Reads the period and shows a progress bar on standard error. The bar moves from `begin` to `end`,
// both between 0 and 1. `shown` must be false if other lines go to the terminal meanwhile.
std::optional<PlatformError> readWithProgress(DryRun& run, const Period& period, bool shown = true,
                                              double begin = 0, double end = 1);

// The names of all platforms.
std::vector<std::string> platformWords();
// The platform of that name; absent if there is none.
std::optional<TesselReporterPlatform> platformNamed(const std::string& name);

// --- Ending a command. Each function prints the reason on stderr, fit for a terminal, and returns
// the exit status.

// "tesselctl: message".
int fail(ExitStatus status, const std::string& message);
// The command line, which begins with `firstWord`, makes no sense to the parser.
int failToParse(const CLI::App& app, const CLI::ParseError& error, const std::string& firstWord);
// A trace store cannot be read.
int failToRead(const PlatformError& error, const std::optional<std::string>& store);
// A file cannot be written.
int failToWrite(const PlatformError& error);
// Warns if some files of a store were not read, since its figures are then too low. Returns kDone
// and prints nothing if all were read.
int warnOfUnreadFiles(const StoreReport& report, const std::optional<std::string>& store);

// --- The commands, each in a file of its own. `app` and `invocation` live until the program ends.

void addRecordCommand(CLI::App& app, Invocation& invocation);
void addExplainCommand(CLI::App& app, Invocation& invocation);
void addCompareCommand(CLI::App& app, Invocation& invocation);
void addEventsCommand(CLI::App& app, Invocation& invocation);
void addRulesCommand(CLI::App& app, Invocation& invocation);
void addStatusCommand(CLI::App& app, Invocation& invocation);
void addDeferCommand(CLI::App& app, Invocation& invocation);
void addTaskingCommand(CLI::App& app, Invocation& invocation);
void addReportCommand(CLI::App& app, Invocation& invocation);

}  // namespace tessel::ctl
