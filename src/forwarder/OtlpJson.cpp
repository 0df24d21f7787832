// OTLP over HTTP in JSON: one log record per event.
//
// A record has the event's name as `eventName`, its time, and the payload's members as flat
// attributes in payload order. An attribute has the kind of its member: string, boolean, integer (a
// decimal string) or double (with the digits of the spool). OTLP has no kind for an integer above
// 2^63-1, so such an integer becomes a string. The attribute `log.record.uid` joins the spool's
// identifier and the row's id. By it a backend recognises a record that arrives twice.
//
// A record goes from the parser's events straight to the writer. A document tree between them was
// discarded: it costs several allocations per attribute and prints numbers anew, so that the
// spool's digits would be lost.

#include "forwarder/Encoder.h"

#include <algorithm>
#include <charconv>
#include <iterator>
#include <limits>
#include <nlohmann/json.hpp>
#include <utility>

#include "platform/Json.h"
#include "platform/Text.h"

namespace tessel {

namespace {

using Json = nlohmann::json;

// These members are floating-point numbers. The spool writes 2.0 for 2, but rows of an older
// version may wait in it that have 2, which looks like an integer. A backend that receives both
// kinds under one name may refuse one of them.
constexpr std::string_view kFloatingKeys[] = {"DurationInSeconds", "FrameRate",
                                              "ProcessingDurationInSeconds"};

bool isFloatingKey(std::string_view key) {
  return std::find(std::begin(kFloatingKeys), std::end(kFloatingKeys), key) !=
         std::end(kFloatingKeys);
}

// One attribute, of the kind "stringValue", "intValue", "boolValue" or "doubleValue".
void writeAttribute(JsonWriter& json, std::string_view key, auto&& writeValue) {
  json.object([&] {
    json.member("key", key);
    json.object("value", writeValue);
  });
}

void writeText(JsonWriter& json, std::string_view key, std::string_view text) {
  writeAttribute(json, key, [&] { json.member("stringValue", text); });
}

// Writes one attribute for each member of a flat object, and stops the parser at anything else. It
// works on the parser's events, because only they have the digits of a number.
class AttributeWriter final : public nlohmann::json_sax<Json> {
 public:
  explicit AttributeWriter(JsonWriter& json) : json_(json) {}

  // The spool writes null for a number that is not finite. The attribute then has no value.
  bool null() override {
    return attribute([] {});
  }
  bool boolean(bool value) override {
    return attribute([&] { json_.member("boolValue", value); });
  }
  bool number_integer(int64_t value) override { return integer(std::to_string(value), true); }
  bool number_unsigned(uint64_t value) override {
    return integer(std::to_string(value), value <= uint64_t{std::numeric_limits<int64_t>::max()});
  }
  bool number_float(double /*value*/, const std::string& digits) override {
    return attribute([&] { json_.rawMember("doubleValue", digits); });
  }
  bool string(std::string& value) override {
    return attribute([&] { json_.member("stringValue", value); });
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
  bool integer(const std::string& digits, bool fitsSigned) {
    if (isFloatingKey(key_)) return number_float(0, digits);
    return attribute([&] { json_.member(fitsSigned ? "intValue" : "stringValue", digits); });
  }
  bool attribute(auto&& writeValue) {
    if (inside_) writeAttribute(json_, key_, writeValue);
    return inside_;
  }

  JsonWriter& json_;
  std::string key_;
  bool inside_ = false;  // the object
};

// In OTLP's JSON a 64-bit integer is a decimal string, but some collectors write a number.
uint64_t integerOf(const nlohmann::json& value) {
  if (value.is_number_unsigned()) return value.get<uint64_t>();
  uint64_t number = 0;
  if (const auto* text = value.get_ptr<const std::string*>()) {
    std::from_chars(text->data(), text->data() + text->size(), number);
  }
  return number;
}

class OtlpEncoder final : public Encoder {
 public:
  explicit OtlpEncoder(const ResourceFacts& facts);
  std::string_view contentType() const override { return "application/json"; }
  std::optional<std::string> record(const SpooledEvent& event,
                                    std::string_view spoolId) const override;
  std::string body(std::span<const OutgoingRecord> records) const override;
  std::optional<PartialSuccess> readSuccess(std::string_view mediaType,
                                            std::string_view body) const override;

 private:
  std::string resource_;  // the same in every body
};

OtlpEncoder::OtlpEncoder(const ResourceFacts& facts) {
  const std::pair<std::string_view, std::string> attributes[] = {
      {"service.name", "tessel_reporter"},
      {"service.version", facts.serviceVersion},
      {"service.instance.id", facts.instanceId.value_or("")},
      {"os.type", "linux"},
      {"os.name", facts.osName},
      {"os.version", facts.osVersion},
      {"host.arch", facts.hostArch},
  };
  JsonWriter json(resource_);
  json.object([&] {
    json.array("attributes", attributes, [&](const auto& attribute) {
      // An unknown fact is left out: an empty text would look like a fact.
      if (!attribute.second.empty()) writeText(json, attribute.first, attribute.second);
    });
  });
}

std::optional<std::string> OtlpEncoder::record(const SpooledEvent& event,
                                               std::string_view spoolId) const {
  // The spool has microseconds and OTLP wants nanoseconds. An event has only this one time, so both
  // times of the record are equal.
  const std::string time = std::to_string(event.time) + "000";
  std::string out;
  JsonWriter json(out);
  bool flat = false;
  json.object([&] {
    json.member("timeUnixNano", time).member("observedTimeUnixNano", time);
    json.member("eventName", event.name);
    json.array("attributes", [&] {
      writeText(json, "log.record.uid", std::string(spoolId) + '-' + std::to_string(event.id));
      AttributeWriter writer(json);
      flat = Json::sax_parse(event.payload, &writer);
    });
  });
  if (!flat) return {};
  return out;
}

std::string OtlpEncoder::body(std::span<const OutgoingRecord> records) const {
  // A body has up to a mebibyte, and growing step by step would copy it several times.
  size_t size = resource_.size() + 256;  // 256: for what stands around the records
  for (const OutgoingRecord& record : records) size += record.text.size() + 1;
  std::string all;
  all.reserve(size);
  JsonWriter json(all);
  const auto scope = [&] {
    json.object("scope", [&] { json.member("name", "com.vantor.tessel.tessel_reporter"); });
    json.array("logRecords", records, [&](const OutgoingRecord& r) { json.raw(r.text); });
  };
  const auto resource = [&] {
    json.rawMember("resource", resource_);
    json.array("scopeLogs", [&] { json.object(scope); });
  };
  json.object([&] { json.array("resourceLogs", [&] { json.object(resource); }); });
  return all;
}

// The protocol's answer to a request is an empty body or an object with nothing in it but a partial
// success. A member that we do not know may stand beside one. An object of other members alone is
// no such answer: {"error": "sign in first"} must not count.
std::optional<PartialSuccess> OtlpEncoder::readSuccess(std::string_view mediaType,
                                                       std::string_view body) const {
  if (trimmed(body).empty()) return PartialSuccess{};
  if (mediaType == "text/html") return {};
  const auto json = Json::parse(body, nullptr, false);
  if (!json.is_object()) return {};
  const auto partial = json.find("partialSuccess");
  if (partial == json.end()) return json.empty() ? std::optional(PartialSuccess{}) : std::nullopt;
  if (!partial->is_object()) return {};
  PartialSuccess told;
  if (const auto rejected = partial->find("rejectedLogRecords"); rejected != partial->end()) {
    told.rejected = integerOf(*rejected);
  }
  if (const auto message = partial->find("errorMessage");
      message != partial->end() && message->is_string()) {
    told.message = message->get<std::string>();
  }
  return told;
}

}  // namespace

extern constexpr OutputFormat kOtlpJson{"otlp", "http/json", "/v1/logs",
                                        [](const ResourceFacts& facts) -> std::unique_ptr<Encoder> {
                                          return std::make_unique<OtlpEncoder>(facts);
                                        }};

}  // namespace tessel
