// ForwarderSettings: the settings that the environment gives the forwarder. Read once, at the
// start.
//
// The collector is set by OpenTelemetry's variables OTEL_EXPORTER_OTLP_<NAME>, where <NAME> is
// ENDPOINT, HEADERS, TIMEOUT, COMPRESSION, CERTIFICATE, CLIENT_CERTIFICATE, CLIENT_KEY or PROTOCOL
// (http/protobuf or http/json). OTEL_EXPORTER_OTLP_LOGS_<NAME> wins over it. Secrets are files in
// $CREDENTIALS_DIRECTORY: otlp-headers, otlp-certificate, otlp-client-certificate, otlp-client-key.
//
//                                                                                 default
//   TESSEL_FORWARD_FORMAT      the output format                                  otlp
//   TESSEL_FORWARD_RATE        records per second; 0: no limit                      100
//   TESSEL_FORWARD_SPREAD      seconds over which a start is spread                 300
//   TESSEL_FORWARD_INTERVAL    seconds between looks for new events                 30
//   TESSEL_FORWARD_RETRY       seconds until the first new attempt, at most         5
//   TESSEL_FORWARD_HOLD        seconds after an answer that holds everything        300
//   TESSEL_FORWARD_ALLOW_HTTP  1: plain http to any host, not to loopback alone     unset
//   TESSEL_FORWARD_INSTANCE_ID 1: say which machine, by an id made for this program unset
//   TESSEL_FORWARD_HEALTH      1: send the event tessel.health                      unset

#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "forwarder/Encoder.h"
#include "linux/LaunchConfiguration.h"

namespace tessel {

// What a request looks like, whoever receives it.
struct EncodingSettings {
  const OutputFormat* output = outputFormats().front();
  ResourceAttributes resourceAttributes;  // of OTEL_RESOURCE_ATTRIBUTES
  bool sendInstanceId = false;
};

struct ForwarderSettings : EncodingSettings {
  std::string url;
  // Where the events go, for people: scheme, host and port of the URL. Users, passwords, paths and
  // queries may hold secrets.
  std::string destination;
  bool loopback = false;                       // whether that is this machine
  std::vector<std::string> headers;            // each "name: value"
  std::chrono::milliseconds timeout{600'000};  // of a request
  std::chrono::milliseconds stall{30'000};     // without a byte; zero: no limit
  bool compress = true;
  // Paths. Empty ones mean the system's authorities and no client certificate, unless a credential
  // has them.
  std::string authorities, clientCertificate, clientKey;
  std::string credentials;  // a directory; empty: none
  uint64_t recordsPerSecond = 100;
  std::chrono::seconds spread{300};
  std::chrono::seconds interval{30};
  std::chrono::milliseconds retry{5000};
  std::chrono::seconds hold{300};
  bool sendHealth = false;
};

// The error is the first variable with an invalid value. A missing endpoint is an error, too. An
// error never quotes headers, because they hold secrets.
std::variant<ForwarderSettings, LaunchError> readForwarderSettings(
    const EnvironmentReader& environment);
// What a request needs beside its body and its address. Secrets are renewed while the forwarder
// runs, so this is read again when credentialsMark() has changed.
struct Credentials {
  std::vector<std::string> headers;  // each "name: value"; those of the variables and of the file
  std::string authorities, clientCertificate, clientKey;
};
// Absent if the file of headers does not hold headers.
std::optional<Credentials> readCredentials(const ForwarderSettings& settings);
// A text that changes with each file of the credentials.
std::string credentialsMark(const ForwarderSettings& settings);
// The headers of each request. A name stands once.
std::vector<std::string> requestHeaders(const ForwarderSettings& settings,
                                        const Credentials& credentials,
                                        std::string_view contentType);

// These settings alone, which need no endpoint.
std::variant<EncodingSettings, LaunchError> readEncodingSettings(
    const EnvironmentReader& environment);

}  // namespace tessel
