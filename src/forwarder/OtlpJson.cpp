// OTLP over HTTP in JSON: one log record per event.
//
// A record has the event's name as `eventName`, its time, and the payload's members as flat
// attributes in payload order. An attribute has the kind of its member: string, boolean, integer (a
// decimal string) or double (the very digits of the spool). OTLP has no kind for an unsigned
// integer above 2^63-1, so that one becomes a string. The attribute `log.record.uid` joins the
// spool's identifier and the row's id, so that a backend can tell a record that arrives twice from
// a new one.
//
// The JSON is written by hand, because a document tree would cost several allocations per attribute
// and would print numbers anew: 0.1f must not come out as 0.10000000149.

#include "forwarder/Encoder.h"

#include <algorithm>
#include <charconv>
#include <iterator>
#include <limits>
#include <nlohmann/json.hpp>
#include <utility>

#include "platform/Json.h"

namespace tessel {

namespace {

using Json = nlohmann::json;

// These members are floating-point numbers, even if their digits look like an integer's: the spool
// writes 2.0 as 2. A backend that met both kinds under one name would refuse one of them.
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

// Appends one attribute for each member of a flat object and stops at anything else. It works on
// the parser's events, because only they carry the digits of a number.
class AttributeWriter final : public nlohmann::json_sax<Json> {
 public:
  explicit AttributeWriter(std::string& out) : out_(out) {}

  // The spool writes null for a number that is not finite. The attribute then has no value.
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
  PartialSuccess partialSuccess(std::string_view answer) const override;

 private:
  std::string head_;  // of every body, up to its first record
};

OtlpEncoder::OtlpEncoder(const ResourceFacts& facts)
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

std::optional<std::string> OtlpEncoder::record(const SpooledEvent& event,
                                               std::string_view spoolId) const {
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

std::string OtlpEncoder::body(std::span<const OutgoingRecord> records) const {
  constexpr std::string_view kTail = "]}]}]}";
  size_t size = head_.size() + kTail.size();
  for (const OutgoingRecord& record : records) size += record.text.size() + 1;
  std::string all;
  all.reserve(size);
  all = head_;
  for (const OutgoingRecord& record : records) {
    if (&record != &records.front()) all += ',';
    all += record.text;
  }
  return all += kTail;
}

PartialSuccess OtlpEncoder::partialSuccess(std::string_view answer) const {
  const auto json = nlohmann::json::parse(answer, nullptr, false);
  if (!json.is_object()) return {};
  const auto partial = json.find("partialSuccess");
  if (partial == json.end() || !partial->is_object()) return {};
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

extern constexpr OutputFormat kOtlpJson{"http/json", "/v1/logs",
                                        [](const ResourceFacts& facts) -> std::unique_ptr<Encoder> {
                                          return std::make_unique<OtlpEncoder>(facts);
                                        }};

}  // namespace tessel
