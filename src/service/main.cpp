// The program tessel_reporter: reads its settings, refuses to start where it cannot work, and gives
// the service the real outside.
//
// The service takes its configuration from the environment and ignores its arguments. Nothing that
// is made here is ever destroyed, because the process may end at any moment and on any thread.

#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "linux/LogSinks.h"
#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "platform/Queues.h"
#include "service/Composition.h"
#include "statora/ConfigurationFiles.h"

namespace tessel {
namespace {

[[noreturn]] void refuse(int status, const std::string& line) {
  std::fprintf(stderr, "tessel_reporter: %s\n", line.c_str());
  std::exit(status);
}

LaunchConfiguration launchConfiguration() {
  auto read = readLaunchConfiguration(processEnvironment());
  if (const auto* error = std::get_if<LaunchError>(&read))
    refuse(kExitConfiguration, error->line());
  return std::get<LaunchConfiguration>(std::move(read));
}

// With too few descriptors every part would fail in a way of its own, and some of them silently: a
// configuration that cannot be opened looks like one that is not there. The run of a single small
// file has 8 open at a time; half of the limit is left to the files of the journal.
void requireDescriptors() {
  constexpr size_t kNeeded = 32;
  const size_t allowed = allowDescriptors(kNeeded);
  if (allowed >= kNeeded) return;
  refuse(kExitDescriptors, "the limit on open files (RLIMIT_NOFILE) is " + std::to_string(allowed) +
                               ", and the service needs " + std::to_string(kNeeded));
}

StateDirectory& stateDirectory(const std::string& path) {
  auto opened = StateDirectory::open(path);
  if (const auto* error = std::get_if<PlatformError>(&opened))
    refuse(kExitStateDirectory, error->words);
  static auto& kept = *new StateDirectory(std::get<StateDirectory>(std::move(opened)));
  return kept;
}

[[noreturn]] void serve() {
  const LaunchConfiguration launch = launchConfiguration();
  requireDescriptors();
  StateDirectory& state = stateDirectory(launch.stateDirectory);
  setLogSink(makeLogSink(launch.logDestination).release(), launch.logLevel);
  for (const PlatformError& refused : state.refusedFiles())
    platformLog().warning("A file in the state directory is not used: %@", refused.words);

  // Each static reference tells a leak checker that the object is meant to stay.
  static auto& clock = *new SystemClock;
  static auto& threads = *new StandardThreads;
  static ServiceManager& manager = *connectServiceManager(clock).release();
  static auto& files = *new LocalFiles;
  static auto& configurations =
      *new FileConfigurationService(launch.configurationDirectory, threads);
  static auto& conditions = *new DeferralConditions(launch.deferOn, state.deferFile());
  ServiceRuntime& runtime =
      startService(launch, {clock, threads, manager, state, files, configurations, conditions});
  const auto processingQueue =
      std::make_shared<WorkerQueue>("tessel_reporter processing queue", threads);
  const auto interruptSource = runtime.makeSignalSource(SIGINT, processingQueue);
  // SIGINT ends the process at once, even in the middle of a run. That run leaves its marker, so
  // the next run bails out.
  interruptSource->setHandler([] { std::exit(0); });
  // Until now an interrupt waits, so that none is handled before every part is made.
  interruptSource->resume();
  runtime.runMainLoop();
}

}  // namespace
}  // namespace tessel

int main() {
  tessel::prepareProcess();
  tessel::serve();
}
