// defer: asks the service to put its runs off, or no longer.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <memory>

#include "linux/StateDirectory.h"
#include "os/Files.h"
#include "os/UniqueFd.h"
#include "tesselctl/commands/Environment.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

namespace {

int sayState(bool json, bool wanted, bool changed, const std::string& file) {
  if (json) {
    print(objectLine([&](JsonWriter& writer) {
      writer.member("defer", wanted).member("changed", changed).member("file", file);
    }));
  } else if (wanted) {
    print(changed ? "Runs are put off from now on; a run under way ends within 10 seconds.\n"
                  : "Runs were put off already.\n");
  } else {
    print(changed ? "Runs are no longer put off.\n" : "Runs were not put off.\n");
  }
  return kDone;
}

int deferOn(const LaunchConfiguration& launch, const std::string& file, bool json) {
  // Made by nobody or by one: the service looks for the file's existence alone.
  const UniqueFd made(::open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644));
  const int error = errno;
  if (!made.valid() && error != EEXIST) return failToWrite(file + ": " + errorWords(error));
  if (!launch.deferOn.file) {
    printError(
        "TESSEL_DEFER_ON does not name \"file\": a service started like this does not look for "
        "it.\n");
  }
  return sayState(json, true, made.valid(), file);
}

int deferOff(const std::string& file, bool json) {
  const bool removed = ::unlink(file.c_str()) == 0;
  const int error = errno;
  if (!removed && error != ENOENT) return failToWrite(file + ": " + errorWords(error));
  return sayState(json, false, removed, file);
}

int runDefer(bool on, bool json) {
  const auto launch = launchConfiguration();
  if (!launch) return kUsage;
  const std::string file = StateDirectory::forReading(launch->stateDirectory).deferFile();
  return on ? deferOn(*launch, file, json) : deferOff(file, json);
}

}  // namespace

void addDeferCommand(CLI::App& app, Invocation& invocation) {
  CLI::App* command = app.add_subcommand("defer", "Put the service's runs off, or no longer");
  command->footer(
      "A run that is put off is offered again every 15 minutes. Written is the file 'defer' in "
      "the\n"
      "state directory ($TESSEL_STATE_DIR).\n\n"
      "Example: keep the machine free for a measurement\n"
      "  tesselctl defer on; ./measure; tesselctl defer off");
  const auto json = std::make_shared<bool>(false);
  command->add_flag("--json", *json, "One JSON object: defer, changed, file");
  command->require_subcommand(1);
  command->fallthrough();
  command->add_subcommand("on", "Put runs off")->callback([&invocation, json] {
    invocation.status = runDefer(true, *json);
  });
  command->add_subcommand("off", "Let runs take place")->callback([&invocation, json] {
    invocation.status = runDefer(false, *json);
  });
}

}  // namespace tessel::ctl
