// Reading the launch variables.
//
// An invalid value ends the process before it has done anything. Going on with the default was
// discarded: an operator who mistypes an interval would notice it weeks later, from missing data.

#include "linux/LaunchConfiguration.h"

#include <charconv>
#include <cstdlib>
#include <system_error>

#include "platform/Text.h"

namespace tessel {

namespace {

// A year. A longer wait is surely a typing mistake, and sums of such times cannot overflow.
constexpr int64_t kMaxSeconds = 31'536'000;
constexpr int64_t kMaxDays = 36'500;  // a hundred years, for the same reason
// A run may take an eighth of what is free. Of an empty spool of 4 MiB its objects get room for 450
// usual ones. An object of the largest size, 240 KB, is over its share there.
constexpr int64_t kMinSpoolBytes = int64_t{4} << 20;
constexpr int64_t kMaxSpoolBytes = int64_t{1} << 40;
constexpr size_t kMaxQuotedValue = 256;  // so that the error stays one readable line
constexpr std::string_view kBlanks = " \t";

std::optional<int64_t> wholeNumber(std::string_view text, int64_t least, int64_t most) {
  int64_t number = 0;
  const char* end = text.data() + text.size();
  const auto [stopped, error] = std::from_chars(text.data(), end, number);
  if (error != std::errc() || stopped != end || number < least || number > most) return {};
  return number;
}

bool enableSource(DeferSources& sources, std::string_view word) {
  for (const DeferWord& row : kDeferWords) {
    if (row.word == word) return sources.*row.source = true;
  }
  return false;
}

std::string expectedDeferWords() {
  std::string words;
  for (const DeferWord& row : kDeferWords) words.append(words.empty() ? "" : ", ").append(row.word);
  return "a comma-separated list of these, or nothing: " + words;
}

std::optional<DeferSources> deferSources(std::string_view list) {
  DeferSources sources;
  if (trimmed(list, kBlanks).empty()) return sources;
  for (;;) {
    const size_t comma = list.find(',');
    if (!enableSource(sources, trimmed(list.substr(0, comma), kBlanks))) return {};
    if (comma == std::string_view::npos) return sources;
    list.remove_prefix(comma + 1);
  }
}

// The first of the directories that the service manager made for the service. The manager joins
// them with colons, in the order of the unit file.
std::optional<std::string> managedDirectory(const EnvironmentReader& environment,
                                            const std::string& name) {
  const std::optional<std::string> list = environment(name);
  if (!list) return {};
  std::string first = list->substr(0, list->find(':'));
  if (first.empty()) return {};
  return first;
}

// Reads the variables one after another and keeps the first error.
class VariableReader {
 public:
  explicit VariableReader(const EnvironmentReader& environment) : environment_(environment) {}

  // If the variable is set, gives `target` the value that `parse` makes of it.
  template <typename Target, typename Parse>
  void read(const std::string& variable, Target& target, const std::string& expected, Parse parse) {
    const std::optional<std::string> text = environment_(variable);
    if (!text) return;
    if (auto value = parse(std::string_view(*text))) {
      target = *value;
    } else if (!error_) {
      error_ = LaunchError{variable, *text, expected};
    }
  }
  // A number of `Unit`s, as "30".
  template <typename Unit>
  void readNumber(const std::string& variable, auto& target, const std::string& unit, int64_t least,
                  int64_t most) {
    const std::string expected = "a whole number of " + unit + " from " + std::to_string(least) +
                                 " to " + std::to_string(most);
    read(variable, target, expected, [least, most](std::string_view text) {
      const std::optional<int64_t> number = wholeNumber(text, least, most);
      return number ? std::optional(Unit(*number)) : std::nullopt;
    });
  }
  void readSeconds(const std::string& variable, auto& target, int64_t least) {
    readNumber<std::chrono::seconds>(variable, target, "seconds", least, kMaxSeconds);
  }
  void readPath(const std::string& variable, auto& target) {
    read(variable, target, "a path", [](std::string_view text) {
      return text.empty() ? std::nullopt : std::optional(std::string(text));
    });
  }
  const std::optional<LaunchError>& error() const { return error_; }

 private:
  const EnvironmentReader& environment_;
  std::optional<LaunchError> error_;
};

std::optional<LogDestination> logDestination(std::string_view text) {
  if (text == "journal") return LogDestination::journal;
  if (text == "stderr") return LogDestination::standardError;
  return {};
}

std::optional<LogLevel> logLevel(std::string_view text) {
  if (text == "error") return LogLevel::error;
  if (text == "debug") return LogLevel::debug;
  return {};
}

}  // namespace

std::string LaunchError::line() const {
  if (!value) return variable + " is not set: expected " + expected;
  std::string shown = value->substr(0, kMaxQuotedValue);
  if (shown.size() < value->size()) shown += "...";
  return variable + "=\"" + plainText(shown, "\\x0a") + "\" makes no sense: expected " + expected;
}

std::variant<LaunchConfiguration, LaunchError> readLaunchConfiguration(
    const EnvironmentReader& environment) {
  LaunchConfiguration configuration;
  if (auto managed = managedDirectory(environment, "STATE_DIRECTORY")) {
    configuration.stateDirectory = *managed;
  }
  if (auto managed = managedDirectory(environment, "CONFIGURATION_DIRECTORY")) {
    configuration.configurationDirectory = *managed;
  }
  // Our own variables come after the manager's directories, so they win.
  VariableReader variables(environment);
  variables.readPath("TESSEL_TRACE_STORE", configuration.traceStore);
  variables.readPath("TESSEL_STATE_DIR", configuration.stateDirectory);
  variables.readPath("TESSEL_CONFIG_DIR", configuration.configurationDirectory);
  variables.readSeconds("TESSEL_ACTIVITY_INTERVAL", configuration.activityInterval, 1);
  variables.readSeconds("TESSEL_DEFER_RETRY", configuration.deferRetry, 1);
  variables.read("TESSEL_DEFER_ON", configuration.deferOn, expectedDeferWords(), deferSources);
  variables.readSeconds("TESSEL_RUN_LIMIT", configuration.runLimit, 0);
  variables.readSeconds("TESSEL_DEFER_LIMIT", configuration.deferLimit, 0);
  variables.readNumber<uint64_t>("TESSEL_SPOOL_LIMIT", configuration.spoolLimitBytes, "bytes",
                                 kMinSpoolBytes, kMaxSpoolBytes);
  variables.readNumber<std::chrono::days>("TESSEL_SPOOL_DAYS", configuration.spoolDays, "days", 0,
                                          kMaxDays);
  variables.read("TESSEL_LOG", configuration.logDestination, "journal or stderr", logDestination);
  variables.read("TESSEL_LOG_LEVEL", configuration.logLevel, "error or debug", logLevel);
  variables.readPath("TESSEL_OS_RELEASE", configuration.osReleasePath);
  if (variables.error()) return *variables.error();
  return configuration;
}

EnvironmentReader processEnvironment() {
  return [](const std::string& name) -> std::optional<std::string> {
    const char* value = std::getenv(name.c_str());
    if (!value) return {};
    return value;
  };
}

}  // namespace tessel
