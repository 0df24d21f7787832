// Writing OTLP's JSON by hand: records are many, and digits of numbers are kept.

#include "forwarder/OtlpBody.h"

#include <sys/utsname.h>
#include <systemd/sd-id128.h>

#include <algorithm>
#include <iterator>
#include <limits>
#include <nlohmann/json.hpp>
#include <utility>

#include "os/Files.h"
#include "platform/Payload.h"

namespace tessel {

namespace {

using Json = nlohmann::json;

constexpr size_t kMaxOsReleaseBytes = size_t{64} << 10;

// Members that are always floating-point, also where their digits look like an integer's.
constexpr std::string_view kFloatingKeys[] = {"DurationInSeconds", "FrameRate",
                                              "ProcessingDurationInSeconds"};

bool isFloatingKey(std::string_view key) {
  return std::find(std::begin(kFloatingKeys), std::end(kFloatingKeys), key) !=
         std::end(kFloatingKeys);
}

void appendStringAttribute(std::string& out, std::string_view key, std::string_view value) {
  out += "{\"key\":";
  appendJsonString(out, key);
  out += ",\"value\":{\"stringValue\":";
  appendJsonString(out, value);
  out += "}}";
}

// Appends one attribute for each member of a flat object; stops at anything else.
class AttributeWriter final : public nlohmann::json_sax<Json> {
 public:
  explicit AttributeWriter(std::string& out) : out_(out) {}

  // A number that is not finite: an attribute without a value.
  bool null() override { return attribute("{}"); }
  bool boolean(bool value) override {
    return attribute(value ? "{\"boolValue\":true}" : "{\"boolValue\":false}");
  }
  bool number_integer(int64_t value) override { return integer(std::to_string(value), true); }
  bool number_unsigned(uint64_t value) override {
    return integer(std::to_string(value), value <= uint64_t{std::numeric_limits<int64_t>::max()});
  }
  bool number_float(double /*value*/, const std::string& digits) override {
    return floating(digits);
  }
  bool string(std::string& value) override {
    if (!inside_) return false;
    appendStringAttribute(separated(), key_, value);
    return true;
  }
  bool binary(Json::binary_t& /*value*/) override { return false; }
  bool start_object(size_t /*size*/) override { return !std::exchange(inside_, true); }
  bool end_object() override { return true; }
  bool start_array(size_t /*size*/) override { return false; }
  bool end_array() override { return false; }
  bool key(std::string& name) override {
    key_ = std::move(name);
    return true;
  }
  bool parse_error(size_t /*position*/, const std::string& /*token*/,
                   const Json::exception& /*error*/) override {
    return false;
  }

 private:
  std::string& separated() { return out_ += ','; }

  bool floating(const std::string& digits) { return attribute("{\"doubleValue\":" + digits + '}'); }
  bool integer(const std::string& digits, bool fitsSigned) {
    if (isFloatingKey(key_)) return floating(digits);
    return attribute((fitsSigned ? "{\"intValue\":\"" : "{\"stringValue\":\"") + digits + "\"}");
  }
  bool attribute(std::string_view value) {
    if (!inside_) return false;
    separated() += "{\"key\":";
    appendJsonString(out_, key_);
    out_.append(",\"value\":").append(value).append("}");
    return true;
  }

  std::string& out_;
  std::string key_;
  bool inside_ = false;  // the object
};

// The value of a line NAME=value of an os-release file, quotes removed; empty where there is none.
std::string osReleaseValue(std::string_view text, std::string_view name) {
  while (!text.empty()) {
    std::string_view line = text.substr(0, text.find('\n'));
    text.remove_prefix(std::min(line.size() + 1, text.size()));
    if (!line.starts_with(name) || line.substr(name.size(), 1) != "=") continue;
    line.remove_prefix(name.size() + 1);
    if (line.size() >= 2 && (line.front() == '"' || line.front() == '\'') &&
        line.back() == line.front()) {
      line = line.substr(1, line.size() - 2);
    }
    return std::string(line);
  }
  return {};
}

std::string architectureName() {
  constexpr std::pair<std::string_view, const char*> kNames[] = {
      {"x86_64", "amd64"},  {"aarch64", "arm64"}, {"i686", "x86"},
      {"i586", "x86"},      {"armv7l", "arm32"},  {"armv6l", "arm32"},
      {"ppc64le", "ppc64"}, {"ppc64", "ppc64"},   {"s390x", "s390x"},
  };
  utsname kernel{};
  if (uname(&kernel) != 0) return {};
  for (const auto& [machine, name] : kNames) {
    if (machine == kernel.machine) return name;
  }
  return kernel.machine;
}

}  // namespace

ResourceFacts readResourceFacts(const std::string& osReleasePath) {
  const std::string text = readSmallFile(osReleasePath, kMaxOsReleaseBytes).value_or("");
  return {TESSEL_VERSION,
          osReleaseValue(text, "NAME"),
          osReleaseValue(text, "VERSION_ID"),
          architectureName(),
          {}};
}

std::optional<std::string> applicationInstanceId() {
  constexpr sd_id128_t kApplication{{0x6b, 0x1d, 0x0a, 0x5c, 0x9e, 0x3f, 0x4f, 0x0c, 0x8b, 0x61,
                                     0xd2, 0x77, 0x3a, 0x90, 0xe4, 0x15}};
  sd_id128_t id{};
  if (sd_id128_get_machine_app_specific(kApplication, &id) < 0) return {};
  char text[SD_ID128_UUID_STRING_MAX];
  return sd_id128_to_uuid_string(id, text);
}

std::optional<std::string> otlpRecord(const SpooledEvent& event, std::string_view spoolId) {
  const std::string time = std::to_string(event.time) + "000";
  std::string out =
      "{\"timeUnixNano\":\"" + time + "\",\"observedTimeUnixNano\":\"" + time + "\",\"eventName\":";
  appendJsonString(out, event.name);
  out += ",\"attributes\":[";
  appendStringAttribute(out, "log.record.uid",
                        std::string(spoolId) + '-' + std::to_string(event.id));
  AttributeWriter writer(out);
  if (!Json::sax_parse(event.payload, &writer)) return {};
  out += "]}";
  return out;
}

OtlpBody::OtlpBody(const ResourceFacts& facts)
    : head_("{\"resourceLogs\":[{\"resource\":{\"attributes\":[") {
  auto add = [this, first = true](std::string_view key, std::string_view value) mutable {
    if (value.empty()) return;
    if (!std::exchange(first, false)) head_ += ',';
    appendStringAttribute(head_, key, value);
  };
  add("service.name", "tessel_reporter");
  add("service.version", facts.serviceVersion);
  add("service.instance.id", facts.instanceId.value_or(""));
  add("os.type", "linux");
  add("os.name", facts.osName);
  add("os.version", facts.osVersion);
  add("host.arch", facts.hostArch);
  head_ +=
      "]},\"scopeLogs\":[{\"scope\":{\"name\":\"com.vantor.tessel.tessel_reporter\"},"
      "\"logRecords\":[";
}

std::string OtlpBody::around(std::span<const OutgoingRecord> records) const {
  constexpr std::string_view kTail = "]}]}]}";
  size_t size = head_.size() + kTail.size();
  for (const OutgoingRecord& record : records) size += record.json.size() + 1;
  std::string body;
  body.reserve(size);
  body = head_;
  for (const OutgoingRecord& record : records) {
    if (&record != &records.front()) body += ',';
    body += record.json;
  }
  return body += kTail;
}

}  // namespace tessel
