// What the environment means, and what makes no sense.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>

#include "linux/LaunchConfiguration.h"

namespace tessel {
namespace {

using Variables = std::map<std::string, std::string>;

std::variant<LaunchConfiguration, LaunchError> readFrom(const Variables& variables) {
  return readLaunchConfiguration([&](const std::string& name) -> std::optional<std::string> {
    const auto found = variables.find(name);
    if (found == variables.end()) return {};
    return found->second;
  });
}

LaunchConfiguration configurationOf(const Variables& variables) {
  const auto result = readFrom(variables);
  if (const auto* error = std::get_if<LaunchError>(&result)) ADD_FAILURE() << error->line();
  const auto* configuration = std::get_if<LaunchConfiguration>(&result);
  return configuration ? *configuration : LaunchConfiguration{};
}

TEST(LaunchConfigurationTest, EveryVariableIsRead) {
  const LaunchConfiguration configuration = configurationOf({{"TESSEL_TRACE_STORE", "store"},
                                                             {"TESSEL_STATE_DIR", "/state"},
                                                             {"TESSEL_CONFIG_DIR", "/config"},
                                                             {"TESSEL_ACTIVITY_INTERVAL", "86400"},
                                                             {"TESSEL_DEFER_RETRY", "1"},
                                                             {"TESSEL_DEFER_ON", "pressure, file"},
                                                             {"TESSEL_RUN_LIMIT", "0"},
                                                             {"TESSEL_DEFER_LIMIT", "0"},
                                                             {"TESSEL_SPOOL_LIMIT", "4194304"},
                                                             {"TESSEL_SPOOL_DAYS", "0"},
                                                             {"TESSEL_LOG", "stderr"},
                                                             {"TESSEL_LOG_LEVEL", "debug"},
                                                             {"TESSEL_OS_RELEASE", "/os-release"}});
  EXPECT_EQ(configuration.traceStore, "store");
  EXPECT_EQ(configuration.stateDirectory, "/state");
  EXPECT_EQ(configuration.configurationDirectory, "/config");
  EXPECT_EQ(configuration.activityInterval, std::chrono::seconds{86400});
  EXPECT_EQ(configuration.deferRetry, std::chrono::seconds{1});
  EXPECT_EQ(configuration.deferOn, (DeferSources{true, false, true}));
  EXPECT_EQ(configuration.runLimit, std::chrono::seconds{0});
  EXPECT_EQ(configuration.deferLimit, std::chrono::seconds{0});
  EXPECT_EQ(configuration.spoolLimitBytes, 4'194'304u);
  EXPECT_EQ(configuration.spoolDays, std::chrono::days{0});
  EXPECT_EQ(configuration.logDestination, LogDestination::standardError);
  EXPECT_EQ(configuration.logLevel, LogLevel::debug);
  EXPECT_EQ(configuration.osReleasePath, "/os-release");
  EXPECT_EQ(configurationOf({}).deferOn, (DeferSources{true, true, true}));
  EXPECT_EQ(configurationOf({{"TESSEL_DEFER_ON", ""}}).deferOn, DeferSources{});
}

TEST(LaunchConfigurationTest, OwnDirectoriesComeFirst) {
  const Variables managed{{"STATE_DIRECTORY", "/managed/state:/managed/more"},
                          {"CONFIGURATION_DIRECTORY", ""}};
  EXPECT_EQ(configurationOf(managed).stateDirectory, "/managed/state");
  EXPECT_EQ(configurationOf(managed).configurationDirectory, "/etc/tessel");
  Variables both = managed;
  both["TESSEL_STATE_DIR"] = "/ours";
  EXPECT_EQ(configurationOf(both).stateDirectory, "/ours");
}

TEST(LaunchConfigurationTest, NonsenseIsNamedOnOneLine) {
  const struct {
    const char* variable;
    const char* value;
  } kCases[] = {{"TESSEL_ACTIVITY_INTERVAL", "soon"},
                {"TESSEL_ACTIVITY_INTERVAL", ""},
                {"TESSEL_ACTIVITY_INTERVAL", "0"},
                {"TESSEL_ACTIVITY_INTERVAL", "-5"},
                {"TESSEL_ACTIVITY_INTERVAL", "+5"},
                {"TESSEL_ACTIVITY_INTERVAL", " 5"},
                {"TESSEL_ACTIVITY_INTERVAL", "1.5"},
                {"TESSEL_ACTIVITY_INTERVAL", "10s"},
                {"TESSEL_ACTIVITY_INTERVAL", "31536001"},
                {"TESSEL_ACTIVITY_INTERVAL", "99999999999999999999"},
                {"TESSEL_DEFER_RETRY", "0"},
                {"TESSEL_DEFER_ON", "file,network"},
                {"TESSEL_DEFER_ON", "file,"},
                {"TESSEL_DEFER_ON", "FILE"},
                {"TESSEL_RUN_LIMIT", "-1"},
                {"TESSEL_DEFER_LIMIT", "never"},
                {"TESSEL_SPOOL_LIMIT", "0"},
                {"TESSEL_SPOOL_LIMIT", "4194303"},
                {"TESSEL_SPOOL_LIMIT", "1G"},
                {"TESSEL_SPOOL_LIMIT", "99999999999999999999"},
                {"TESSEL_SPOOL_DAYS", "-1"},
                {"TESSEL_SPOOL_DAYS", "36501"},
                {"TESSEL_LOG", "syslog"},
                {"TESSEL_LOG_LEVEL", "verbose"},
                {"TESSEL_TRACE_STORE", ""},
                {"TESSEL_STATE_DIR", ""}};
  for (const auto& [variable, value] : kCases) {
    const auto result = readFrom({{variable, value}});
    const auto* error = std::get_if<LaunchError>(&result);
    ASSERT_NE(error, nullptr) << variable << "=" << value;
    EXPECT_THAT(error->line(), ::testing::HasSubstr(std::string(variable) + "=\"" + value + "\""));
  }
}

TEST(LaunchConfigurationTest, AValueCannotBreakItsLine) {
  const auto result = readFrom({{"TESSEL_LOG", "a\nb\x1b[2J" + std::string(100'000, 'x')}});
  const std::string line = std::get<LaunchError>(result).line();
  EXPECT_THAT(line, ::testing::HasSubstr("\"a\\x0ab\\x1b[2Jxxx"));
  EXPECT_EQ(line.find('\n'), std::string::npos);
  EXPECT_LT(line.size(), 600u);
}

}  // namespace
}  // namespace tessel
