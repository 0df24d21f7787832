// Reading the forwarder's variables.
//
// Where OpenTelemetry has a variable we use its name, because people who run a collector know it.
// Secrets may come as files, because every process of the user can read an environment.

#include "forwarder/Settings.h"

#include <arpa/inet.h>
#include <curl/curl.h>
#include <sys/stat.h>

#include <algorithm>
#include <charconv>
#include <filesystem>
#include <functional>
#include <memory>
#include <string_view>
#include <utility>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

namespace {

constexpr size_t kMaxCredentialBytes = size_t{64} << 10;  // servers refuse headers of that size

using Headers = std::vector<std::string>;

struct Variable {
  std::string name;
  std::string value;
};

// Reads variables and keeps the first error.
class Variables {
 public:
  explicit Variables(const EnvironmentReader& environment) : environment_(environment) {}

  // By OpenTelemetry's rules an empty variable counts as unset.
  std::optional<std::string> value(const std::string& name) const {
    std::optional<std::string> text = environment_(name);
    if (text && text->empty()) text.reset();
    return text;
  }
  // OTEL_EXPORTER_OTLP_LOGS_<name>, or else OTEL_EXPORTER_OTLP_<name>. The answer holds the
  // full name, so that an error names the variable that the operator has set.
  std::optional<Variable> standard(const std::string& name) const {
    for (const char* prefix : {"OTEL_EXPORTER_OTLP_LOGS_", "OTEL_EXPORTER_OTLP_"}) {
      if (auto text = value(prefix + name)) return Variable{prefix + name, std::move(*text)};
    }
    return {};
  }
  std::string path(const std::string& name) const {
    return standard(name).value_or(Variable{}).value;
  }
  // Keeps the first error only: later ones often follow from it.
  void complain(const std::string& name, std::optional<std::string> text,
                const std::string& expected) {
    if (!error_) error_ = LaunchError{name, std::move(text), expected};
  }
  // A whole number from `least` to 31,536,000, which is a year in seconds. A larger one is surely a
  // typing mistake, and sums of such times cannot overflow.
  std::optional<int64_t> number(const std::string& name, int64_t least) {
    const auto text = value(name);
    if (!text) return {};
    int64_t parsed = 0;
    const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), parsed);
    if (error == std::errc() && end == text->data() + text->size() && parsed >= least &&
        parsed <= 31'536'000) {
      return parsed;
    }
    complain(name, *text, "a whole number up to 31536000");
    return {};
  }
  bool flag(const std::string& name) {
    const std::string text = value(name).value_or("0");
    if (text != "0" && text != "1") complain(name, text, "0 or 1");
    return text == "1";
  }
  const std::optional<LaunchError>& error() const { return error_; }

 private:
  const EnvironmentReader& environment_;
  std::optional<LaunchError> error_;
};

// `text` with %XX decoded. Absent if the result holds a control character: a line feed would let a
// value add headers of its own.
std::optional<std::string> decoded(std::string_view text) {
  std::string out;
  for (size_t at = 0; at < text.size(); ++at) {
    char byte = text[at];
    if (byte == '%') {
      unsigned code = 0;
      if (at + 2 >= text.size() ||
          std::from_chars(text.data() + at + 1, text.data() + at + 3, code, 16).ptr !=
              text.data() + at + 3) {
        return {};
      }
      byte = static_cast<char>(code);
      at += 2;
    }
    if (static_cast<unsigned char>(byte) < 0x20 || byte == 0x7f) return {};
    out += byte;
  }
  return out;
}

using Members = std::vector<std::pair<std::string, std::string>>;

constexpr char kMembersForm[] = "name=value,name=value, percent-encoded";

// Reads such a list. Absent if the text has another form.
std::optional<Members> parseMembers(std::string_view text) {
  Members members;
  while (!text.empty()) {
    const std::string_view member = trimmed(text.substr(0, text.find(',')));
    text.remove_prefix(std::min(
        text.find(',') == std::string_view::npos ? text.size() : text.find(',') + 1, text.size()));
    if (member.empty()) continue;
    const size_t equals = member.find('=');
    if (equals == 0 || equals == std::string_view::npos) return {};
    auto name = decoded(trimmed(member.substr(0, equals)));
    auto value = decoded(trimmed(member.substr(equals + 1)));
    if (!name || !value) return {};
    members.emplace_back(std::move(*name), std::move(*value));
  }
  return members;
}

std::optional<Headers> parseHeaders(std::string_view text) {
  const auto members = parseMembers(text);
  if (!members) return {};
  Headers headers;
  for (const auto& [name, value] : *members) {
    if (name.find(':') != std::string::npos) return {};
    headers.push_back(name + ": " + value);
  }
  return headers;
}

using CurlUrl = std::unique_ptr<CURLU, decltype(&curl_url_cleanup)>;

std::string urlPart(CURLU* url, CURLUPart part) {
  char* text = nullptr;
  if (curl_url_get(url, part, &text, 0) != CURLUE_OK) return {};
  const std::unique_ptr<char, decltype(&curl_free)> owned(text, &curl_free);
  return text;
}

// Accepts only names and addresses that can never mean another machine. Other names are not
// resolved, because their address may change before the request.
bool isLoopback(const std::string& host) {
  if (host == "localhost" || host == "[::1]") return true;
  in_addr address{};
  return inet_pton(AF_INET, host.c_str(), &address) == 1 && (ntohl(address.s_addr) >> 24) == 127;
}

// Scheme, host and port, or nothing if the text is no URL.
std::string destinationOf(CURLU* url) {
  const std::string scheme = urlPart(url, CURLUPART_SCHEME);
  const std::string host = urlPart(url, CURLUPART_HOST);
  const std::string port = urlPart(url, CURLUPART_PORT);
  if (scheme.empty() || host.empty()) return {};
  return scheme + "://" + host + (port.empty() ? "" : ":" + port);
}

// TESSEL_FORWARD_FORMAT names the format. Only OTLP has protocols to choose from.
const OutputFormat* readOutput(Variables& variables) {
  const std::span<const OutputFormat* const> formats = outputFormats();
  const auto choose = [&](const Variable& variable, std::string_view OutputFormat::*name,
                          const auto& eligible) {
    std::string known;
    for (const OutputFormat* format : formats) {
      if (!eligible(*format)) continue;
      if (format->*name == variable.value) return format;
      if (known.find(format->*name) == std::string::npos)
        known.append(known.empty() ? "" : " or ").append(format->*name);
    }
    variables.complain(variable.name, variable.value, known);
    return formats.front();
  };
  const Variable wanted{
      "TESSEL_FORWARD_FORMAT",
      variables.value("TESSEL_FORWARD_FORMAT").value_or(std::string(formats.front()->format))};
  const OutputFormat* const first =
      choose(wanted, &OutputFormat::format, [](const OutputFormat&) { return true; });
  const auto protocol = variables.standard("PROTOCOL");
  if (!protocol || first->protocol.empty()) return first;
  return choose(*protocol, &OutputFormat::protocol,
                [&](const OutputFormat& format) { return format.format == first->format; });
}

// OpenTelemetry's rule: the address for all signals gets the path of this signal appended, and the
// address for logs is complete as it is. A query stays behind the path.
void appendPath(CURLU* url, std::string_view path) {
  std::string whole = urlPart(url, CURLUPART_PATH);
  while (whole.ends_with('/')) whole.pop_back();
  whole.append(path);
  curl_url_set(url, CURLUPART_PATH, whole.c_str(), 0);
}

// Plain http shows events and credentials to the network. So it needs the operator's consent,
// unless the request stays on this machine.
void readEndpoint(Variables& variables, ForwarderSettings& settings) {
  const bool allowHttp = variables.flag("TESSEL_FORWARD_ALLOW_HTTP");
  const auto endpoint = variables.standard("ENDPOINT");
  if (!endpoint) {
    variables.complain("OTEL_EXPORTER_OTLP_ENDPOINT", {},
                       "the URL of a collector, in /etc/statora/forwarder.env or as Environment= "
                       "by 'systemctl edit statora-forwarder'");
    return;
  }
  const CurlUrl url(curl_url(), &curl_url_cleanup);
  const bool valid =
      curl_url_set(url.get(), CURLUPART_URL, endpoint->value.c_str(), 0) == CURLUE_OK;
  settings.loopback = isLoopback(urlPart(url.get(), CURLUPART_HOST));
  settings.destination = destinationOf(url.get());
  const std::string scheme = urlPart(url.get(), CURLUPART_SCHEME);
  if (!valid || (scheme != "https" && !(scheme == "http" && (allowHttp || settings.loopback)))) {
    // The whole text may hold a password, even where it is no URL.
    variables.complain(
        endpoint->name, settings.destination.empty() ? "(not shown: no URL)" : settings.destination,
        "an https URL, or an http one to loopback (to any host with TESSEL_FORWARD_ALLOW_HTTP=1)");
    return;
  }
  if (endpoint->name == "OTEL_EXPORTER_OTLP_ENDPOINT" && !settings.output->path.empty())
    appendPath(url.get(), settings.output->path);
  settings.url = urlPart(url.get(), CURLUPART_URL);
}

void readEncoding(Variables& variables, EncodingSettings& settings) {
  settings.output = readOutput(variables);
  settings.sendInstanceId = variables.flag("TESSEL_FORWARD_INSTANCE_ID");
  const auto text = variables.value("OTEL_RESOURCE_ATTRIBUTES");
  if (!text) return;
  auto members = parseMembers(*text);
  // A text that is not UTF-8 would make receivers refuse every request.
  const auto isText = [](const auto& member) {
    return isValidUtf8(member.first) && isValidUtf8(member.second);
  };
  if (!members || !std::ranges::all_of(*members, isText))
    return variables.complain("OTEL_RESOURCE_ATTRIBUTES", *text, kMembersForm);
  settings.resourceAttributes = std::move(*members);
}

std::string headersFile(const ForwarderSettings& settings) {
  return settings.credentials + "/otlp-headers";
}

// The service manager makes $CREDENTIALS_DIRECTORY. Only this service can read its files, and they
// are gone when the service ends.
void readCredentialsDirectory(Variables& variables, ForwarderSettings& settings) {
  settings.credentials = variables.value("CREDENTIALS_DIRECTORY").value_or("");
  if (!readCredentials(settings))
    variables.complain("otlp-headers in CREDENTIALS_DIRECTORY", "(not shown)", kMembersForm);
}

// The path of a variable, or else of a credential that exists.
std::string pathOf(const ForwarderSettings& settings, const std::string& variable,
                   const char* name) {
  if (!variable.empty() || settings.credentials.empty()) return variable;
  std::error_code ignored;
  const std::string path = settings.credentials + "/" + name;
  return std::filesystem::exists(path, ignored) ? path : "";
}

std::string nameOf(std::string_view header) {
  std::string name(header.substr(0, header.find(':')));
  std::transform(name.begin(), name.end(), name.begin(), [](char letter) {
    return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter - 'A' + 'a') : letter;
  });
  return name;
}

void readTransport(Variables& variables, ForwarderSettings& settings) {
  if (const auto headers = variables.standard("HEADERS")) {
    const auto parsed = parseHeaders(headers->value);
    if (!parsed) variables.complain(headers->name, "(not shown)", kMembersForm);
    settings.headers = parsed.value_or(Headers{});
  }
  // The standard's limit is for the whole request. Whoever sets it may want to wait for longer than
  // we would without a byte.
  if (const auto timeout = variables.standard("TIMEOUT")) {
    settings.timeout = std::chrono::milliseconds{variables.number(timeout->name, 1).value_or(1)};
    settings.stall = std::chrono::milliseconds{0};
  }
  if (const auto compression = variables.standard("COMPRESSION")) {
    settings.compress = compression->value == "gzip";
    if (!settings.compress && compression->value != "none") {
      variables.complain(compression->name, compression->value, "gzip or none");
    }
  }
  settings.authorities = variables.path("CERTIFICATE");
  settings.clientCertificate = variables.path("CLIENT_CERTIFICATE");
  settings.clientKey = variables.path("CLIENT_KEY");
}

}  // namespace

std::variant<ForwarderSettings, LaunchError> readForwarderSettings(
    const EnvironmentReader& environment) {
  ForwarderSettings settings;
  Variables variables(environment);
  // The format comes first, because the endpoint's path depends on it.
  readEncoding(variables, settings);
  readEndpoint(variables, settings);
  readTransport(variables, settings);
  readCredentialsDirectory(variables, settings);
  const auto seconds = [&variables](const char* name, auto& target, int64_t least) {
    if (const auto value = variables.number(name, least)) target = std::chrono::seconds{*value};
  };
  seconds("TESSEL_FORWARD_SPREAD", settings.spread, 0);
  seconds("TESSEL_FORWARD_INTERVAL", settings.interval, 1);
  seconds("TESSEL_FORWARD_RETRY", settings.retry, 1);
  seconds("TESSEL_FORWARD_HOLD", settings.hold, 1);
  if (const auto rate = variables.number("TESSEL_FORWARD_RATE", 0)) {
    settings.recordsPerSecond = static_cast<uint64_t>(*rate);
  }
  settings.sendHealth = variables.flag("TESSEL_FORWARD_HEALTH");
  if (variables.error()) return *variables.error();
  return settings;
}

std::optional<Credentials> readCredentials(const ForwarderSettings& settings) {
  Credentials read{settings.headers, pathOf(settings, settings.authorities, "otlp-certificate"),
                   pathOf(settings, settings.clientCertificate, "otlp-client-certificate"),
                   pathOf(settings, settings.clientKey, "otlp-client-key")};
  if (settings.credentials.empty()) return read;
  const auto text = readSmallFile(headersFile(settings), kMaxCredentialBytes);
  const auto headers = parseHeaders(trimmed(text.value_or("")));
  if (!headers) return {};
  read.headers.insert(read.headers.end(), headers->begin(), headers->end());
  return read;
}

std::string credentialsMark(const ForwarderSettings& settings) {
  std::string mark;
  for (const std::string& path :
       {headersFile(settings), pathOf(settings, settings.authorities, "otlp-certificate"),
        pathOf(settings, settings.clientCertificate, "otlp-client-certificate"),
        pathOf(settings, settings.clientKey, "otlp-client-key")}) {
    struct stat facts {};
    // The number of the file changes when a new one takes its place within one tick of the clock.
    if (::stat(path.c_str(), &facts) == 0)
      mark += std::to_string(facts.st_ino) + ' ' + std::to_string(facts.st_size) + ' ' +
              std::to_string(facts.st_mtim.tv_sec) + ' ' + std::to_string(facts.st_mtim.tv_nsec);
    mark += ';';
  }
  return mark;
}

std::vector<std::string> requestHeaders(const ForwarderSettings& settings,
                                        const Credentials& credentials,
                                        std::string_view contentType) {
  // Without "Expect:" libcurl would ask before each large body whether it may send it, and wait.
  std::vector<std::string> all{"Content-Type: " + std::string(contentType), "Expect:"};
  if (settings.compress) all.emplace_back("Content-Encoding: gzip");
  for (const std::string& header : credentials.headers) {
    const std::string name = nameOf(header);
    // These tell how our body is made, so nobody else can know better. Only a format that goes to
    // servers of every kind may need another type than ours.
    const bool ours = name == "content-encoding" || name == "content-length" ||
                      name == "transfer-encoding" || name == "expect" ||
                      (name == "content-type" && !settings.output->protocol.empty());
    if (ours) continue;
    // The file comes after the variables, and it is what operators renew.
    std::erase_if(all, [&](const std::string& earlier) { return nameOf(earlier) == name; });
    all.push_back(header);
  }
  return all;
}

std::variant<EncodingSettings, LaunchError> readEncodingSettings(
    const EnvironmentReader& environment) {
  EncodingSettings settings;
  Variables variables(environment);
  readEncoding(variables, settings);
  if (variables.error()) return *variables.error();
  return settings;
}

}  // namespace tessel
