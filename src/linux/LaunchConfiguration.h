// LaunchConfiguration: what the environment says about this process, read once before anything is
// started. A plain value, safe to share once made.

#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/Log.h"

namespace tessel {

// Exit statuses of the service besides 0, as in sysexits.h.
inline constexpr int kExitConfiguration = 78;   // a launch variable makes no sense
inline constexpr int kExitStateDirectory = 73;  // the state directory cannot be used

// What may defer a run.
struct DeferSources {
  bool file = false;      // <state>/defer exists
  bool battery = false;   // on battery, and it is low
  bool pressure = false;  // tasks wait for the CPU

  bool operator==(const DeferSources&) const = default;
};

enum class LogDestination { journal, standardError };

struct LaunchConfiguration {
  std::optional<std::string> traceStore;  // absent: the machine's own journal
  std::string stateDirectory = "/var/lib/tessel";
  std::string configurationDirectory = "/etc/tessel";
  std::optional<std::chrono::seconds> activityInterval;  // absent: one run, then the process ends
  std::chrono::seconds deferRetry{900};
  DeferSources deferOn{true, true, true};
  std::optional<LogDestination> logDestination;  // absent: the journal where there is one
  LogLevel logLevel = LogLevel::error;
  std::string osReleasePath = "/etc/os-release";
};

// A launch variable that makes no sense.
struct LaunchError {
  std::string variable;
  std::string value;
  std::string expected;  // what would make sense

  // One line without a line feed, fit for a terminal, that names variable and value.
  std::string line() const;
};

// The value of an environment variable; nothing where it is not set.
using EnvironmentReader = std::function<std::optional<std::string>(const std::string& name)>;

// Reads every launch variable; the first one that makes no sense is the error. Touches nothing but
// the reader.
std::variant<LaunchConfiguration, LaunchError> readLaunchConfiguration(
    const EnvironmentReader& environment);

// The process's own environment.
EnvironmentReader processEnvironment();

}  // namespace tessel
