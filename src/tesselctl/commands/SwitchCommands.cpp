// defer and tasking: the two switches of the service.
//
// Each switch is a file that the service looks for. A file needs no running service, so a switch
// can be set before the service starts and survives a reboot.

#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <initializer_list>
#include <utility>
#include <variant>

#include "linux/StateDirectory.h"
#include "os/Files.h"
#include "platform/Text.h"
#include "statora/ConfigurationFiles.h"
#include "tasking/TaskingGate.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/Tasking.h"
#include "tesselctl/reading/TimeArguments.h"

namespace tessel::ctl {

namespace {

// The service runs as a user of its own and must be able to read what we write as root.
constexpr unsigned kConfigurationMode = 0644;

struct SwitchOptions {
  bool json = false;
  // Of "tasking on".
  std::optional<std::string> share, cohort;
};
struct Position {
  const char* name;
  const char* description;
  int (*take)(const SwitchOptions&, const Surroundings&);
};

// Lets each position share the options of its command. fallthrough() is what lets --json stand
// behind the position as well: "tasking show --json".
AddedCommand<SwitchOptions> addSwitch(CLI::App& app, Invocation& invocation,
                                      const CommandText& text, const char* json,
                                      std::initializer_list<Position> positions) {
  const auto options = std::make_shared<SwitchOptions>();
  CLI::App* command = app.add_subcommand(text.name, text.description);
  command->footer(text.footer);
  command->add_flag("--json", options->json, json);
  addColourOption(*command, invocation);
  command->require_subcommand(1);
  for (const auto& [name, description, take] : positions) {
    CLI::App* position = command->add_subcommand(name, description);
    setAction(*position->fallthrough(), invocation, options, take);
  }
  return {*command, *options};
}

std::string deferFile(const Surroundings& surroundings) {
  return StateDirectory::forReading(surroundings.launch.stateDirectory).deferFile();
}

// A run that waits looks for the file only when its next offer is due. Whoever ends the deferral
// must know how long nothing may happen.
int showDeferral(const SwitchOptions& options, const Surroundings& surroundings, bool wanted,
                 bool changed, const std::string& file) {
  if (options.json) {
    print(objectLine([&](JsonWriter& json) {
      json.member("defer", wanted).member("changed", changed).member("file", file);
    }));
  } else if (wanted) {
    print(changed
              ? "Runs are put off from now on; a run under way stops reading within 20 seconds.\n"
              : "Runs were put off already.\n");
  } else {
    print(changed ? "Runs are no longer put off; one that waits begins within " +
                        durationText(surroundings.launch.deferRetry) + ".\n"
                  : "Runs were not put off.\n");
  }
  return kDone;
}

int deferOn(const SwitchOptions& options, const Surroundings& surroundings) {
  const std::string file = deferFile(surroundings);
  // The kernel makes the file only if there is none. So `made` is true for one caller alone, and a
  // script can trust "changed" to know whether it must switch back. errno is copied at once,
  // because later calls change it.
  const bool made = createNewFile(file, kConfigurationMode);
  const int error = errno;
  if (!made && error != EEXIST) return failToWrite(fileError(file, error));
  // We make the file all the same. The service may have been started with another environment than
  // this shell has.
  if (!surroundings.launch.deferOn.file) {
    printError(
        "TESSEL_DEFER_ON does not name \"file\": a service started like this does not look for "
        "it.\n");
  }
  return showDeferral(options, surroundings, true, made, file);
}

int deferOff(const SwitchOptions& options, const Surroundings& surroundings) {
  const std::string file = deferFile(surroundings);
  // A file that is already gone is the state the caller asked for. "changed" then says false, and
  // the exit status is good.
  const bool removed = ::unlink(file.c_str()) == 0;
  const int error = errno;
  if (!removed && error != ENOENT) return failToWrite(fileError(file, error));
  return showDeferral(options, surroundings, false, removed, file);
}

// The configuration with the new answer. Keys of other owners stay as they are. So a file that
// holds something we do not understand is not replaced: only its owner can tell what would be lost.
std::variant<std::string, PlatformError> changedConfiguration(const std::string& file, bool on) {
  auto looked = lookAtConfiguration(file);
  if (auto* error = std::get_if<PlatformError>(&looked)) return std::move(*error);
  const auto& found = std::get<ConfigurationFile>(looked);
  if (found.exists && !found.text) {
    if (::access(file.c_str(), R_OK) != 0) return fileError(file, errno);
    return PlatformError{ErrorCode::failed,
                         file + ": it is no regular file of at most 1 MiB, and stays as it is"};
  }
  std::string text = found.text.value_or("");
  if (text.find_first_not_of(" \t\r\n") == std::string::npos) text = "{}\n";
  const auto configuration = parseConfiguration(text);
  if (!configuration ||
      !std::holds_alternative<ConfigurationValue::Dictionary>(configuration->value))
    return PlatformError{
        ErrorCode::failed,
        file + ": it holds no JSON object, and stays as it is; correct or remove it"};
  return withMember(text, kTaskedOnKey, on ? "true" : "false");
}

int showTasking(const SwitchOptions& options, const Surroundings& surroundings) {
  const Tasking tasking = askTasking(surroundings.launch);
  if (options.json) {
    print(objectLine([&](JsonWriter& json) {
      json.member("tasked", tasking.decision.on());
      json.member("source", taskingSourceName(tasking.decision.source()));
      json.member("file", tasking.file);
      if (!tasking.rollout) return;
      json.member("share", tasking.rollout->percent()).member("cohort", tasking.rollout->cohort);
      json.member("in_share", tasking.inShare());
    }));
  } else {
    const bool on = tasking.decision.on();
    print(surroundings.terminal.paint(on ? Colour::good : Colour::caution, on ? "on" : "off") +
          ": " + terminalText(taskingWords(tasking, surroundings.launch)) + "\n");
  }
  return kDone;
}

// Whether this machine belongs to the share, after which the roll-out is noted. The note comes
// before the answer: without it nobody could say later why a machine reports.
std::variant<bool, PlatformError> noteRollout(const LaunchConfiguration& launch,
                                              const std::optional<Rollout>& rollout) {
  bool in = true;
  if (rollout) {
    const auto place = placeOf(machineId().value_or(""), rollout->cohort);
    if (!place)
      return PlatformError{ErrorCode::failed,
                           "/etc/machine-id: this machine has no id that decides; nothing changed"};
    in = *place < rollout->share;
  }
  if (auto failure = writeRollout(launch, rollout)) return std::move(*failure);
  return in;
}

int switchTasking(const SwitchOptions& options, const Surroundings& surroundings, bool on,
                  const std::optional<Rollout>& rollout = {}) {
  const std::string& directory = surroundings.launch.configurationDirectory;
  std::error_code error;
  // is_directory() may report an absent directory as an error. create_directories() clears
  // `error` if it succeeds, so what is left below is a real failure.
  if (!std::filesystem::is_directory(directory, error))
    std::filesystem::create_directories(directory, error);
  if (error) return failToWrite(fileError(directory, error.value()));
  // The service watches the file and may read it while we write. Half a text is no JSON and gives
  // no answer, so the file is replaced in one step.
  const std::string file = taskingFile(surroundings.launch);
  // Asked for before anything is written, so that a file we must not touch leaves all as it was.
  auto changed = changedConfiguration(file, on);
  if (const auto* refusal = std::get_if<PlatformError>(&changed)) return failToWrite(*refusal);
  const auto noted = noteRollout(surroundings.launch, rollout);
  if (const auto* failure = std::get_if<PlatformError>(&noted)) return failToWrite(*failure);
  if (!std::get<bool>(noted)) changed = changedConfiguration(file, false);
  if (const auto* refusal = std::get_if<PlatformError>(&changed)) return failToWrite(*refusal);
  if (const auto failure =
          replaceFileDurably(file, std::get<std::string>(changed), kConfigurationMode))
    return failToWrite(*failure);
  // We show what the rules of the service now decide, not what was asked for: an internal build
  // reports even after "off".
  return showTasking(options, surroundings);
}
// A share without a cohort is that of the cohort which decided last, so that a greater share takes
// more of the same machines.
int taskingOn(const SwitchOptions& options, const Surroundings& surroundings) {
  if (!options.share) return switchTasking(options, surroundings, true);
  const auto share = shareOf(*options.share);
  if (!share)
    return fail(kUsage, "--share " + terminalText(*options.share) +
                            ": give a percentage from 0% to 100%, such as 5% or 0.25%");
  const auto before = readRollout(surroundings.launch);
  const std::string cohort =
      options.cohort.value_or(before ? before->cohort : std::string(kDefaultCohort));
  if (!isCohortName(cohort))
    return fail(kUsage, "--cohort " + terminalText(cohort) +
                            ": give 1 to 64 letters, digits, dots, hyphens or underscores");
  return switchTasking(options, surroundings, true, Rollout{*share, cohort});
}
int taskingOff(const SwitchOptions& options, const Surroundings& surroundings) {
  return switchTasking(options, surroundings, false);
}

CommandText deferText() {
  return {"defer", "Put the service's runs off, or no longer",
          helpText("A run that is put off is offered again every 15 minutes. Written is the file "
                   "'defer' in the state directory.") +
              helpEnvironment({"TESSEL_STATE_DIR", "TESSEL_DEFER_ON", "TESSEL_DEFER_RETRY"}) +
              "Example: keep the machine free for a measurement\n"
              "  tesselctl defer on; ./measure; tesselctl defer off"};
}

CommandText taskingText() {
  return {
      "tasking", "Switch reporting on or off, or show which it is",
      helpText("Written is TaskedOn in com.vantor.performance.tessel_reporter_tasking.json, in "
               "the configuration directory. A build with internal diagnostics reports whatever "
               "it says.") +
          helpEnvironment({"TESSEL_CONFIG_DIR", "TESSEL_OS_RELEASE"}) +
          "Example: switch reporting on, and see that it is\n"
          "  sudo tesselctl tasking on\n"
          "  tesselctl tasking show\n"
          "Example: begin with one machine in twenty\n"
          "  sudo tesselctl tasking on --share 5% --cohort spring"};
}

}  // namespace

void addDeferCommand(CLI::App& app, Invocation& invocation) {
  addSwitch(app, invocation, deferText(), "One JSON object: defer, changed, file",
            {{"on", "Put runs off", deferOn}, {"off", "Let runs take place", deferOff}});
}

void addTaskingCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] =
      addSwitch(app, invocation, taskingText(),
                "One JSON object: tasked, source, file, and of a roll-out share, cohort, in_share",
                {{"on", "Report", taskingOn},
                 {"off", "Do not report", taskingOff},
                 {"show", "Say whether this machine reports, and what says so", showTasking}});
  CLI::App* const on = command.get_subcommand("on");
  CLI::Option* const share = on->add_option(
      "--share", options.share, "Report only if the machine belongs to this share, such as 5%");
  on->add_option("--cohort", options.cohort,
                 "The roll-out that draws the machines, by its name [the last one, else default]")
      ->needs(share);
}

}  // namespace tessel::ctl
