// The environment, the options for reading a store, and failures in words.

#include "tesselctl/commands/Command.h"

#include <unistd.h>

#include <algorithm>

#include "linux/SystemFacts.h"
#include "platform/Text.h"
#include "tasking/TaskingGate.h"
#include "tesselctl/reading/TimeZone.h"
#include "whitelist/PlatformProfile.h"

namespace tessel::ctl {

namespace {

// The exit status depends on the error code alone. We never search the words of an error, since
// they contain a path, and a path may hold "Permission denied".
ExitStatus statusOf(const PlatformError& error) {
  return error.code == ErrorCode::noAccess ? kNoAccess : kBad;
}

// Prints the error. A refused access can be mended by the user, so a hint follows it on the line.
int failWithHint(const PlatformError& error, const char* accessHint, const char* otherHint = "") {
  const ExitStatus status = statusOf(error);
  return fail(status, error.words + (status == kNoAccess ? accessHint : otherHint));
}

constexpr std::string_view kExportHint =
    "pipe the entries to it: journalctl -o export | tesselctl ... --store -";

int warnOfBrokenStream(const FileReport& stream) {
  const std::vector<Loss> problems = stream.problems.all();
  if (problems.empty()) return kDone;
  uint64_t count = 0;
  for (const Loss& problem : problems) count += problem.count;
  const Loss& first = *std::ranges::min_element(
      problems, {}, [](const Loss& problem) { return problem.place.offset.value_or(0); });
  std::string words = stream.path + " is broken in " + counted(count, "place", "places") +
                      ", first at byte " + std::to_string(first.place.offset.value_or(0)) + ": " +
                      first.words;
  if (stream.entriesRead == 0) words += "; " + std::string(kExportHint);
  return fail(kBad, words);
}

}  // namespace

// A message may quote a path or a word of the command line. terminalText() keeps control characters
// in them from acting on the terminal.
int fail(ExitStatus status, const std::string& message) {
  printError("tesselctl: " + terminalText(message) + "\n");
  return status;
}

int failToRead(const PlatformError& error, const std::optional<std::string>& store) {
  return failWithHint(
      error,
      store ? "; run tesselctl as a user who may read the store"
            : "; run tesselctl as root, or join the group and log in again: sudo usermod --append "
              "--groups systemd-journal $USER",
      store ? "; a store is a directory with *.journal, *.journal~ or *.export files, or one such "
              "file"
            : "");
}

int failToWrite(const PlatformError& error) {
  return failWithHint(error,
                      "; run tesselctl as root, or as the user that the directory belongs to");
}

// We report refused files first, since another user can read them. A store of too many files stays
// one for every user. Only one of the two sets the exit status.
int warnOfUnreadFiles(const StoreReport& report, const std::optional<std::string>& store) {
  const auto refused = [](const FileReport& file) { return file.refused; };
  const auto first = std::find_if(report.files.begin(), report.files.end(), refused);
  if (first != report.files.end()) {
    const auto count = std::count_if(first, report.files.end(), refused);
    return failToRead({ErrorCode::noAccess, counted(static_cast<uint64_t>(count), "file", "files") +
                                                " of the store could not be read, the first is " +
                                                first->path + ": " + first->skipped.value_or("")},
                      store);
  }
  // Nobody can look at a stream again to see how much of it was read.
  if (store == kStandardInput && !report.files.empty()) return warnOfBrokenStream(report.files[0]);
  const uint64_t notLookedAt = report.reading.losses.sum(LossCode::filesNotLookedAt);
  if (notLookedAt == 0) return kDone;
  return fail(
      kBad, counted(notLookedAt, "file", "files") + " of the store were one too many and not read");
}

// The environment is read by the code of the service. A variable that stops the service stops us
// too, so we never show the figures of another store.
std::optional<Surroundings> lookAround(const Invocation& invocation) {
  auto launch = readLaunchConfiguration(processEnvironment());
  if (const auto* error = std::get_if<LaunchError>(&launch)) {
    fail(kUsage, error->line());
    return {};
  }
  const ColourChoice choice = invocation.colour == "always"  ? ColourChoice::always
                              : invocation.colour == "never" ? ColourChoice::never
                                                             : ColourChoice::automatic;
  return Surroundings{std::get<LaunchConfiguration>(std::move(launch)), SystemClock().now(),
                      terminalBehind(STDOUT_FILENO, choice)};
}

void checkZone() {
  if (const auto unknown = replaceUnknownZone()) {
    printError("tesselctl: $TZ: '" + terminalText(*unknown) +
               "' is no time zone that is known here; dates are read and shown in UTC\n");
  }
}

// The option stands before a command and behind it, since users of other tools try both. The help
// of each command shows it, from which the completion of the shell learns it.
void addColourOption(CLI::App& app, Invocation& invocation) {
  auto* option = app.add_option(
      "--color", invocation.colour,
      "Colours: auto (on a terminal, unless $NO_COLOR is set), always or never [auto]");
  takesOneOf(option, {"auto", "always", "never"})->type_name("WHEN");
}

void addPeriodOptions(CLI::App& command, ReadingOptions& options) {
  suggestsFiles(
      command.add_option(
          "--store", options.store,
          "Directory with *.journal and *.export files, or one such file, or - for the output of "
          "'journalctl -o export' on standard input [$TESSEL_TRACE_STORE, else the machine's "
          "journal]"))
      ->type_name("PATH");
  command
      .add_option("--since", options.period.since,
                  "Begin of the period: 2026-11-22, '2026-11-22 21:45 CET', 21:45, yesterday, "
                  "monday, -24h, '2 hours ago', or as journalctl prints it [a day before its "
                  "end]")
      ->type_name("DATE");
  command.add_option("--until", options.period.until, "End of the period, in the same forms [now]")
      ->type_name("DATE");
  command
      .add_option("--last", options.period.last,
                  "Length of the period, up to its end: 30m, 24h, 7d")
      ->type_name("DURATION");
}

void addJudgeOptions(CLI::App& command, ReadingOptions& options) {
  takesOneOf(
      command.add_option("--platform", options.platform,
                         "Judge as on this platform: " + platformNames() + " [this build's]"),
      platformWords())
      ->type_name("NAME");
  const auto internal =
      command.add_flag("--internal", options.internal,
                       "Judge as on a build with internal diagnostics [as this machine says]");
  command.add_flag("--no-internal", options.external, "Judge as on any other build")
      ->excludes(internal);
}

CLI::Option* addPatterns(CLI::App& command, const char* name, std::vector<std::string>& patterns,
                         const char* help) {
  // Each --name takes one word. If it took more, it would swallow the words that follow it.
  return command.add_option(name, patterns, help)->allow_extra_args(false)->type_name("PATTERN");
}

std::vector<std::string> platformWords() {
  std::vector<std::string> names;
  // The first profile is that of no platform, which nobody can choose.
  for (const PlatformProfile& profile : platformProfiles().subspan<1>())
    names.emplace_back(profile.name);
  return names;
}

std::optional<TesselReporterPlatform> platformNamed(const std::string& name) {
  // We match names exactly, because the service does. A name that we accepted more freely would be
  // unknown to the service.
  const auto platform = platformFromName(SharedString(name));
  return platform == TesselReporterPlatform::unknown ? std::nullopt : std::optional(platform);
}

std::optional<Reading> readingOf(const ReadingOptions& options, const Surroundings& surroundings) {
  const LaunchConfiguration& launch = surroundings.launch;
  Reading reading;
  // An option outranks the environment, and the environment outranks the machine's own journal.
  reading.store = options.store ? options.store : launch.traceStore;
  if (options.store == kStandardInput && ::isatty(STDIN_FILENO) == 1) {
    fail(kUsage,
         "--store: '-' is standard input, which is a terminal; " + std::string(kExportHint));
    return {};
  }
  // To the service "-" is a directory like any other, and we read what the service reads.
  if (!options.store && launch.traceStore == kStandardInput) reading.store = "./-";
  const PeriodResult period = periodOf(options.period, surroundings.now);
  if (!period.period) {
    fail(kUsage, period.error);
    return {};
  }
  reading.period = *period.period;
  if (options.platform)
    reading.machine.platform = platformNamed(*options.platform).value_or(reading.machine.platform);
  // The file of the operating system is asked last: an option must give the same answer on each
  // machine, also where the file is missing.
  reading.machine.internal =
      options.internal ||
      (!options.external &&
       OsReleaseBuildVariant(launch.osReleasePath).hasInternalDiagnostics(kBuildVariantSubsystem));
  return reading;
}

std::optional<PlatformError> readWithProgress(DryRun& run, const Period& period, bool shown,
                                              double begin, double end) {
  ProgressBar bar(shown);
  return run.read(period, [&](double part, uint64_t entries) {
    bar.update(begin + part * (end - begin), entries);
  });
}

}  // namespace tessel::ctl
