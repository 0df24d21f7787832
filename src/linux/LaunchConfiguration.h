// LaunchConfiguration: the settings that the environment gives this process. It is read once,
// before anything is started. A plain value; any thread.

#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/Log.h"

namespace tessel {

// Exit statuses of the service besides 0, as in sysexits.h.
inline constexpr int kExitConfiguration = 78;   // a launch variable has an invalid value
inline constexpr int kExitStateDirectory = 73;  // the state directory cannot be used
inline constexpr int kExitDescriptors = 71;     // the process may not open enough files

// What may defer a run.
struct DeferSources {
  bool file = false;      // the file <state>/defer
  bool battery = false;   // a low battery while the machine runs on it
  bool pressure = false;  // tasks that wait for the CPU

  bool operator==(const DeferSources&) const = default;
};

// The words of TESSEL_DEFER_ON. A new source is a member, its row here, and its check in
// DeferralConditions.
struct DeferWord {
  std::string_view word;
  bool DeferSources::*source;
};
inline constexpr DeferWord kDeferWords[] = {{"file", &DeferSources::file},
                                            {"battery", &DeferSources::battery},
                                            {"pressure", &DeferSources::pressure}};

constexpr DeferSources allDeferSources() {
  DeferSources all;
  for (const DeferWord& row : kDeferWords) all.*row.source = true;
  return all;
}

enum class LogDestination { journal, standardError };

struct LaunchConfiguration {
  std::optional<std::string> traceStore;  // absent: the machine's own journal
  std::string stateDirectory = "/var/lib/tessel";
  std::string configurationDirectory = "/etc/tessel";
  std::optional<std::chrono::seconds> activityInterval;  // absent: one run, then the process ends
  std::chrono::seconds deferRetry{900};
  DeferSources deferOn = allDeferSources();
  std::chrono::seconds runLimit{21'600};  // the longest run; zero: no limit
  // For how long battery and pressure may put one run off, in all. Zero: not at all.
  std::chrono::seconds deferLimit{7200};
  uint64_t spoolLimitBytes = uint64_t{1} << 30;  // of the database and its log together
  std::chrono::days spoolDays{30};               // how long a row may stay; zero: for ever
  std::optional<LogDestination> logDestination;  // absent: the journal where there is one
  LogLevel logLevel = LogLevel::error;
  std::string osReleasePath = "/etc/os-release";
};

// A variable with an invalid value.
struct LaunchError {
  std::string variable;
  std::optional<std::string> value;  // absent if it must be set and is not
  std::string expected;              // which values are valid

  // One line that names variable and value. It has no line feed and is fit for a terminal.
  std::string line() const;
};

// The value of an environment variable. Absent if it is not set.
using EnvironmentReader = std::function<std::optional<std::string>(const std::string& name)>;

// Reads every launch variable. The error is the first variable with an invalid value. Touches
// nothing but the reader.
std::variant<LaunchConfiguration, LaunchError> readLaunchConfiguration(
    const EnvironmentReader& environment);

// The process's own environment.
EnvironmentReader processEnvironment();

}  // namespace tessel
