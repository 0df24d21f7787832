// What the environment says, and what makes no sense.

#include "forwarder/Settings.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>

namespace tessel {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

using Environment = std::map<std::string, std::string>;

std::variant<ForwarderSettings, LaunchError> read(const Environment& environment) {
  return readForwarderSettings([&](const std::string& name) -> std::optional<std::string> {
    const auto found = environment.find(name);
    if (found == environment.end()) return {};
    return found->second;
  });
}

ForwarderSettings settingsOf(Environment environment) {
  environment.emplace("OTEL_EXPORTER_OTLP_ENDPOINT", "https://collector.example");
  const auto result = read(environment);
  if (const auto* error = std::get_if<LaunchError>(&result)) ADD_FAILURE() << error->line();
  return std::holds_alternative<ForwarderSettings>(result) ? std::get<ForwarderSettings>(result)
                                                           : ForwarderSettings{};
}

TEST(ForwarderSettingsTest, TheLogsEndpointComesFirst) {
  const struct {
    Environment environment;
    const char* url;
  } cases[] = {
      {{{"OTEL_EXPORTER_OTLP_ENDPOINT", "https://c.example:4318"}},
       "https://c.example:4318/v1/logs"},
      {{{"OTEL_EXPORTER_OTLP_ENDPOINT", "https://c.example/otlp//"}},
       "https://c.example/otlp/v1/logs"},
      {{{"OTEL_EXPORTER_OTLP_LOGS_ENDPOINT", "https://l.example/x"}}, "https://l.example/x"},
      {{{"OTEL_EXPORTER_OTLP_ENDPOINT", "https://l.example/x/?a=b/"},
        {"TESSEL_FORWARD_FORMAT", "ndjson"}},
       "https://l.example/x/?a=b/"},
      {{{"OTEL_EXPORTER_OTLP_ENDPOINT", "http://127.0.0.1:4318"}}, "http://127.0.0.1:4318/v1/logs"},
      {{{"OTEL_EXPORTER_OTLP_ENDPOINT", "http://[::1]:4318"}}, "http://[::1]:4318/v1/logs"},
      {{{"OTEL_EXPORTER_OTLP_ENDPOINT", "http://c.example"}, {"TESSEL_FORWARD_ALLOW_HTTP", "1"}},
       "http://c.example/v1/logs"},
  };
  for (const auto& c : cases) EXPECT_EQ(settingsOf(c.environment).url, c.url);
}

TEST(ForwarderSettingsTest, HeadersArePercentDecoded) {
  EXPECT_THAT(settingsOf({{"OTEL_EXPORTER_OTLP_HEADERS", " a = b%20c , d=e=f,,g="}}).headers,
              ElementsAre("a: b c", "d: e=f", "g: "));
  const ForwarderSettings settings = settingsOf({{"OTEL_EXPORTER_OTLP_TIMEOUT", "1"},
                                                 {"OTEL_EXPORTER_OTLP_LOGS_TIMEOUT", "2500"},
                                                 {"OTEL_EXPORTER_OTLP_LOGS_COMPRESSION", "gzip"},
                                                 {"OTEL_EXPORTER_OTLP_CERTIFICATE", "/a"},
                                                 {"OTEL_EXPORTER_OTLP_CLIENT_KEY", ""},
                                                 {"TESSEL_FORWARD_RATE", "0"}});
  EXPECT_EQ(settings.timeout, std::chrono::milliseconds{2500});
  EXPECT_TRUE(settings.compress);
  EXPECT_EQ(settings.authorities, "/a");
  EXPECT_EQ(settings.clientKey, "");
  EXPECT_EQ(settings.recordsPerSecond, 0u);
  EXPECT_EQ(settingsOf({}).recordsPerSecond, 100u);
}

TEST(ForwarderSettingsTest, AMissingAddressSaysWhereItBelongs) {
  const auto result = read({});
  EXPECT_EQ(std::get<LaunchError>(result).line(),
            "OTEL_EXPORTER_OTLP_ENDPOINT is not set: expected the URL of a collector, in "
            "/etc/statora/forwarder.env or as Environment= by 'systemctl edit statora-forwarder'");
}

TEST(ForwarderSettingsTest, ErrorsNameNoSecrets) {
  const struct {
    const char* name;
    const char* value;
  } cases[] = {
      {"OTEL_EXPORTER_OTLP_ENDPOINT", ""},
      {"OTEL_EXPORTER_OTLP_ENDPOINT", "collector"},
      {"OTEL_EXPORTER_OTLP_ENDPOINT", "http://127.0.0.1.example"},
      {"OTEL_EXPORTER_OTLP_COMPRESSION", "brotli"},
      {"TESSEL_FORWARD_RATE", "-1"},
      {"OTEL_EXPORTER_OTLP_ENDPOINT", "file:///etc/passwd"},
      {"OTEL_EXPORTER_OTLP_HEADERS", "hidden"},
      {"OTEL_EXPORTER_OTLP_HEADERS", "hidden=a%0d%0ab: c"},
      {"OTEL_EXPORTER_OTLP_HEADERS", "hidden=a%2"},
      {"OTEL_EXPORTER_OTLP_HEADERS", "hi:dden=a"},
      {"OTEL_EXPORTER_OTLP_TIMEOUT", "0"},
      {"OTEL_EXPORTER_OTLP_TIMEOUT", "10s"},
      {"OTEL_EXPORTER_OTLP_PROTOCOL", "grpc"},
      {"TESSEL_FORWARD_INTERVAL", "0"},
      {"TESSEL_FORWARD_ALLOW_HTTP", "yes"},
  };
  for (const auto& c : cases) {
    Environment environment{{"OTEL_EXPORTER_OTLP_ENDPOINT", "https://collector.example"}};
    environment[c.name] = c.value;
    const auto result = read(environment);
    ASSERT_TRUE(std::holds_alternative<LaunchError>(result)) << c.name << "=" << c.value;
    EXPECT_THAT(std::get<LaunchError>(result).line(), HasSubstr(c.name));
    EXPECT_THAT(std::get<LaunchError>(result).line(), Not(HasSubstr("hidden")));
  }
}

}  // namespace
}  // namespace tessel
