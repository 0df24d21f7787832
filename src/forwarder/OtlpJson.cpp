// OTLP over HTTP in JSON: one log record per event.
//
// A record has the event's name as `eventName`, its time, and the payload's members as flat
// attributes in payload order. An attribute has the kind of its member: string, boolean, integer (a
// decimal string) or double (with the digits of the spool). OTLP has no kind for an integer above
// 2^63-1, so such an integer becomes a string.

#include "forwarder/Otlp.h"
#include "forwarder/PayloadWalk.h"
#include "platform/Json.h"

namespace tessel {

namespace {

// Writes each member as an attribute: {"key":...,"value":{"stringValue":...}}.
class JsonAttributes {
 public:
  explicit JsonAttributes(JsonWriter& json) : json_(json) {}

  void text(std::string_view key, std::string_view value) {
    attribute(key, [&] { json_.member("stringValue", value); });
  }
  void boolean(std::string_view key, bool value) {
    attribute(key, [&] { json_.member("boolValue", value); });
  }
  void integer(std::string_view key, int64_t value) {
    attribute(key, [&] { json_.member("intValue", std::to_string(value)); });
  }
  void largeInteger(std::string_view key, std::string_view digits) { text(key, digits); }
  void floating(std::string_view key, double /*value*/, std::string_view digits) {
    attribute(key, [&] { json_.rawMember("doubleValue", digits); });
  }
  void nothing(std::string_view key) {
    attribute(key, [] {});
  }

 private:
  void attribute(std::string_view key, auto&& writeValue) {
    json_.object([&] {
      json_.member("key", key);
      json_.object("value", writeValue);
    });
  }

  JsonWriter& json_;
};

class OtlpJsonEncoder final : public Encoder {
 public:
  explicit OtlpJsonEncoder(const Resources& resources)
      : resources_{resourceOf(resources.ofRows), resourceOf(resources.ofHealth)} {}

  std::string_view contentType() const override { return "application/json"; }
  std::optional<std::string> record(const SpooledEvent& event, std::string_view uid) const override;
  std::string body(std::span<const OutgoingRecord> records) const override;
  std::optional<PartialSuccess> readSuccess(std::string_view mediaType,
                                            std::string_view body) const override {
    return readOtlpSuccess(mediaType, body);
  }

 private:
  static std::string resourceOf(const ResourceAttributes& attributes) {
    std::string resource;
    JsonWriter json(resource);
    json.object([&] {
      json.array("attributes", attributes, [&](const auto& attribute) {
        JsonAttributes(json).text(attribute.first, attribute.second);
      });
    });
    return resource;
  }

  const std::array<std::string, 2> resources_;  // see groupByResource()
};

std::optional<std::string> OtlpJsonEncoder::record(const SpooledEvent& event,
                                                   std::string_view uid) const {
  // An event has only this one time, so both times of the record are equal.
  const std::string time = std::to_string(nanosecondsOf(event.time));
  std::string out;
  JsonWriter json(out);
  bool flat = false;
  json.object([&] {
    json.member("timeUnixNano", time).member("observedTimeUnixNano", time);
    json.member("eventName", event.name);
    json.array("attributes", [&] {
      JsonAttributes attributes(json);
      attributes.text(kUidAttribute, uid);
      attributes.text(kEventNameAttribute, event.name);
      flat = walkPayload(event.payload, attributes);
    });
  });
  if (!flat) return {};
  return out;
}

std::string OtlpJsonEncoder::body(std::span<const OutgoingRecord> records) const {
  // A body has up to a mebibyte, and growing step by step would copy it several times.
  size_t size =
      resources_[0].size() + resources_[1].size() + 512;  // what stands around the records
  for (const OutgoingRecord& record : records) size += record.text.size() + 1;
  std::string all;
  all.reserve(size);
  JsonWriter json(all);
  const auto scopeLogs = [&](const RecordGroup& group) {
    json.object("scope", [&] { json.member("name", kOtlpScope); });
    json.array("logRecords", group.records, [&](const OutgoingRecord* r) { json.raw(r->text); });
  };
  const auto resourceLogs = [&](const RecordGroup& group) {
    json.object([&] {
      json.rawMember("resource", group.resource);
      json.array("scopeLogs", [&] { json.object([&] { scopeLogs(group); }); });
    });
  };
  json.object(
      [&] { json.array("resourceLogs", groupByResource(records, resources_), resourceLogs); });
  // Blanks after JSON mean nothing, and this one parts the bodies where --dry-run prints several.
  all += '\n';
  return all;
}

}  // namespace

extern constexpr OutputFormat kOtlpJson{"otlp", "http/json", kOtlpLogsPath,
                                        [](const Resources& resources) -> std::unique_ptr<Encoder> {
                                          return std::make_unique<OtlpJsonEncoder>(resources);
                                        }};

}  // namespace tessel
