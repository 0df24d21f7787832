// tasking: switches reporting on or off, and shows which it is.

#include <CLI/CLI.hpp>
#include <filesystem>
#include <memory>
#include <nlohmann/json.hpp>

#include "os/DurableFile.h"
#include "os/Files.h"
#include "platform/Text.h"
#include "statora/ConfigurationFiles.h"
#include "tasking/TaskingGate.h"
#include "tesselctl/commands/Environment.h"
#include "tesselctl/judging/Tasking.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

namespace {

using Json = nlohmann::ordered_json;

constexpr unsigned kReadableByAll = 0644;  // the service runs as a user of its own

// The configuration with its answer changed; what else it holds is kept.
std::string changedConfiguration(const std::string& file, bool on) {
  const auto text = readSmallFile(file, FileConfigurationService::kMaxFileBytes);
  Json configuration = text ? Json::parse(*text, nullptr, false) : Json::object();
  if (!configuration.is_object()) configuration = Json::object();
  configuration[kTaskedOnKey] = on;
  return configuration.dump(2, ' ', false, Json::error_handler_t::replace) + "\n";
}

int show(const LaunchConfiguration& launch, bool json) {
  const Tasking tasking = askTasking(launch);
  if (json) {
    print(objectLine([&](JsonWriter& writer) {
      writer.member("tasked", tasking.decision.on())
          .member("source", taskingSourceName(tasking.decision.source()));
      writer.member("file", tasking.file);
    }));
  } else {
    const Terminal terminal = terminalBehind(1);
    print(terminal.paint(tasking.decision.on() ? Colour::good : Colour::caution,
                         tasking.decision.on() ? "on" : "off") +
          ": " + terminalText(taskingWords(tasking, launch)) + "\n");
  }
  return kDone;
}

int switchTasking(const LaunchConfiguration& launch, bool on, bool json) {
  const std::string file = taskingFile(launch);
  if (!std::filesystem::is_directory(launch.configurationDirectory)) {
    std::error_code error;
    std::filesystem::create_directories(launch.configurationDirectory, error);
    if (error) return failToWrite(launch.configurationDirectory + ": " + errorWords(error.value()));
  }
  if (const auto reason =
          replaceFileDurably(file, changedConfiguration(file, on), kReadableByAll)) {
    return failToWrite(*reason);
  }
  return show(launch, json);
}

template <typename Action>
void addAction(CLI::App& command, const char* name, const char* description, Invocation& invocation,
               Action action) {
  command.add_subcommand(name, description)->callback([&invocation, action] {
    const auto launch = launchConfiguration();
    invocation.status = launch ? action(*launch) : kUsage;
  });
}

}  // namespace

void addTaskingCommand(CLI::App& app, Invocation& invocation) {
  CLI::App* command =
      app.add_subcommand("tasking", "Switch reporting on or off, or show which it is");
  command->footer(
      "Written is the tasking configuration in the configuration directory ($TESSEL_CONFIG_DIR).\n"
      "A build with internal diagnostics reports whatever it says.\n\n"
      "Example: switch reporting on, and see that it is\n"
      "  sudo tesselctl tasking on\n"
      "  tesselctl tasking show");
  const auto json = std::make_shared<bool>(false);
  command->add_flag("--json", *json, "One JSON object: tasked, source, file");
  command->require_subcommand(1);
  command->fallthrough();
  addAction(*command, "on", "Report", invocation, [json](const LaunchConfiguration& launch) {
    return switchTasking(launch, true, *json);
  });
  addAction(
      *command, "off", "Do not report", invocation,
      [json](const LaunchConfiguration& launch) { return switchTasking(launch, false, *json); });
  addAction(*command, "show", "Say whether this machine reports, and what says so", invocation,
            [json](const LaunchConfiguration& launch) { return show(launch, *json); });
}

}  // namespace tessel::ctl
