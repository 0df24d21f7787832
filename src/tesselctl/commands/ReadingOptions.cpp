// Store, period and judge from the command line.

#include "tesselctl/commands/ReadingOptions.h"

#include <cerrno>

#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "platform/Text.h"
#include "tasking/TaskingGate.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

void addPeriodOptions(CLI::App& command, ReadingOptions& options) {
  command.add_option(
      "--store", options.store,
      "Directory with *.journal and *.export files, or one such file [$TESSEL_TRACE_STORE, "
      "else the machine's journal]");
  command.add_option("--since", options.period.since,
                     "Begin of the period: 2026-11-22, '2026-11-22 21:45', 21:45, yesterday, -24h, "
                     "'2 hours ago' [a day before its end]");
  command.add_option("--until", options.period.until, "End of the period, in the same forms [now]");
  command.add_option("--last", options.period.last,
                     "Length of the period, up to its end: 30m, 24h, 7d");
}

void addJudgeOptions(CLI::App& command, ReadingOptions& options) {
  command.add_option("--platform", options.platform,
                     "Judge as on this platform: " + platformNames() + " [this build's]");
  const auto internal =
      command.add_flag("--internal", options.internal,
                       "Judge as on a build with internal diagnostics [as this machine says]");
  command.add_flag("--no-internal", options.external, "Judge as on any other build")
      ->excludes(internal);
}

std::optional<TesselReporterPlatform> platformNamed(const std::string& name) {
  const auto platform = platformFromName(SharedString(name));
  return platform == TesselReporterPlatform::unknown ? std::nullopt : std::optional(platform);
}

std::optional<Reading> readingOf(const ReadingOptions& options, const LaunchConfiguration& launch,
                                 Date now) {
  Reading reading;
  reading.store = options.store ? options.store : launch.traceStore;
  PeriodResult period = periodOf(options.period, now);
  if (!period.period) {
    fail(kUsage, period.error);
    return {};
  }
  reading.period = *period.period;
  if (options.platform) {
    const auto platform = platformNamed(*options.platform);
    if (!platform) {
      fail(kUsage,
           "--platform: '" + terminalText(*options.platform) + "' is none of " + platformNames());
      return {};
    }
    reading.machine.platform = *platform;
  }
  reading.machine.internal =
      options.internal ||
      (!options.external &&
       OsReleaseBuildVariant(launch.osReleasePath).hasInternalDiagnostics(kBuildVariantSubsystem));
  return reading;
}

int warnOfUnreadFiles(const StoreReport& report, const std::optional<std::string>& store,
                      int status) {
  const uint64_t notLookedAt = report.reading.losses.sum(LossCode::filesNotLookedAt);
  uint64_t refused = 0;
  const std::string* first = nullptr;
  for (const FileReport& file : report.files) {
    if (!file.skipped || !speaksOfPermission(*file.skipped)) continue;
    ++refused;
    if (first == nullptr) first = &file.path;
  }
  if (refused != 0) {
    return failToRead(counted(refused, "file", "files") +
                          " of the store could not be read, the first is " + *first + ": " +
                          errorWords(EACCES),
                      store);
  }
  if (notLookedAt != 0) {
    fail(kBad,
         counted(notLookedAt, "file", "files") + " of the store were one too many and not read");
    return kBad;
  }
  return status;
}

}  // namespace tessel::ctl
