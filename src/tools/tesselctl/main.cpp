// tesselctl: the companion of the service on the command line.

#include <algorithm>
#include <cstdio>

#include "tools/tesselctl/Commands.h"

namespace tessel::ctl {

int fail(ExitStatus status, const std::string& message) {
  std::string shown = "tesselctl: " + message + "\n";
  // No text of the outside may move the cursor or change colours.
  const auto isControl = [](char c) {
    return (static_cast<unsigned char>(c) < ' ' && c != '\n') || c == 0x7f;
  };
  std::replace_if(shown.begin(), shown.end(), isControl, '?');
  std::fputs(shown.c_str(), stderr);
  return status;
}

namespace {

constexpr const char* kFooter =
    "Exit status: 0 done; 1 the answer is bad; 2 usage; 4 no access.\n"
    "'tesselctl COMMAND --help' says more about a command.";

// Takes what stands behind "--" off the arguments.
std::optional<std::vector<std::string>> takeCommand(std::vector<std::string>& arguments) {
  const auto dashes = std::find(arguments.begin(), arguments.end(), "--");
  if (dashes == arguments.end()) return std::nullopt;
  std::vector<std::string> command(dashes + 1, arguments.end());
  arguments.erase(dashes, arguments.end());
  return command;
}

int run(std::vector<std::string> arguments) {
  Invocation invocation;
  invocation.command = takeCommand(arguments);
  CLI::App app("Records trace points and shows what tessel_reporter makes of them.", "tesselctl");
  app.require_subcommand(1);
  app.footer(kFooter);
  addRecordCommand(app, invocation);
  std::reverse(arguments.begin(), arguments.end());  // as the parser wants them
  try {
    app.parse(std::move(arguments));
  } catch (const CLI::ParseError& error) {
    if (app.get_subcommands().empty() && !app.remaining().empty()) {
      return fail(kUsage, "no command is called '" + app.remaining().front() + "'; see --help");
    }
    return app.exit(error) == 0 ? kDone : kUsage;
  }
  return invocation.status;
}

}  // namespace

}  // namespace tessel::ctl

int main(int argc, char** argv) { return tessel::ctl::run({argv + 1, argv + argc}); }
