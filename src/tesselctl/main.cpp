// tesselctl: the companion of the service on the command line.

#include <algorithm>
#include <memory>
#include <sstream>

#include "tesselctl/commands/Command.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

namespace {

// The completion of the shell asks with this. It is for nobody else, so --help does not name it.
constexpr std::string_view kComplete = "--complete";

std::string footer() {
  return helpTable("What answers which question",
                   {{"tesselctl explain", "why was this trace point not reported?"},
                    {"tesselctl rules check WORD", "may I write this word?"},
                    {"tesselctl events --sent", "what left this machine?"},
                    {"tesselctl status", "is this machine well?"},
                    {"tesselctl compare since=-14d,until=-7d last=7d",
                     "what became slower since last week?"}}) +
         helpText(
             "Exit status: 0 done; 1 it could not be done, or the answer is bad; 2 the command "
             "line "
             "or the environment makes no sense; 4 no access. Standard output is for a terminal, "
             "or "
             "else one record a line; --json is for programs.") +
         helpEnvironment({"TZ", "COLUMNS", "NO_COLOR"}) +
         "'tesselctl COMMAND --help' says all about a command, with its variables.";
}

// Takes the words behind "--" off the arguments. They belong to another program, and the parser
// would read its options as ours. Absent means no "--"; empty means that nothing followed it.
std::optional<std::vector<std::string>> takeCommand(std::vector<std::string>& arguments) {
  const auto dashes = std::find(arguments.begin(), arguments.end(), "--");
  if (dashes == arguments.end()) return std::nullopt;
  std::vector<std::string> command(dashes + 1, arguments.end());
  arguments.erase(dashes, arguments.end());
  return command;
}

// The parser reports --help and --version as errors of status 0. Its other statuses are numbers of
// its own, and a script knows only ours. It would write to the streams of C++, which report no full
// disk and escape nothing that the command line holds. So it writes to a string, and we print that.
int end(const CLI::App& app, const CLI::ParseError& error, const std::string& firstWord) {
  std::ostringstream out;
  std::ostringstream complaint;
  if (app.exit(error, out, complaint) == 0) {
    print(out.str());
    return kDone;
  }
  return failToParse(app, error, firstWord);
}

int run(std::vector<std::string> arguments) {
  Invocation invocation;
  if (arguments.empty() || arguments[0] != kComplete) invocation.command = takeCommand(arguments);
  CLI::App app("Records trace points and shows what tessel_reporter makes of them.", "tesselctl");
  app.require_subcommand(1);
  app.footer(footer());
  formatHelp(app);
  addRecordCommand(app, invocation);
  addExplainCommand(app, invocation);
  addCompareCommand(app, invocation);
  addEventsCommand(app, invocation);
  addRulesCommand(app, invocation);
  addStatusCommand(app, invocation);
  addDeferCommand(app, invocation);
  addTaskingCommand(app, invocation);
  addReportCommand(app, invocation);
  addColourOption(app, invocation);
  app.set_version_flag("--version", "tesselctl " TESSEL_VERSION, "Print the version");
  if (!arguments.empty() && arguments[0] == kComplete) {
    arguments.erase(arguments.begin());
    return complete(app, arguments);
  }
  refuseValuesOfFlags(app);
  const std::string firstWord = arguments.empty() ? "" : arguments[0];
  std::reverse(arguments.begin(), arguments.end());  // the parser takes words from the end
  try {
    app.parse(std::move(arguments));
  } catch (const CLI::ParseError& error) {
    return end(app, error, firstWord);
  }
  return invocation.status;
}

}  // namespace

}  // namespace tessel::ctl

int main(int argc, char** argv) {
  tessel::ctl::prepareOutput();
  const int status = tessel::ctl::run({argv + 1, argv + argc});
  // exit() would write what the buffer still holds and ignore a full disk.
  tessel::ctl::flushOutput();
  return status;
}
