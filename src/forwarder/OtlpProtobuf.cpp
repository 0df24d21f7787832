// OTLP over HTTP in binary protobuf, which every receiver must take: one log record per event.
//
// The fields are those of OtlpJson.cpp. A field number stands for a name that a receiver has and we
// have not, so a wrong number would go unnoticed here. scripts/check_otlp_schema reads the bodies
// with the official definitions. Fields stand in the order of their numbers, so that a writer made
// from the definitions gives the very same bytes.
//
// A generated writer was discarded: it needs a compiler in the build, a library at run time, and an
// object for each attribute. Six kinds of message are few enough to write by hand.

#include <protozero/pbf_writer.hpp>

#include "forwarder/Otlp.h"
#include "forwarder/PayloadWalk.h"
#include "platform/Invariant.h"
#include "platform/Text.h"

namespace tessel {

namespace {

using protozero::pbf_writer;

// The numbers of the fields, by message.
enum Request : protozero::pbf_tag_type { kResourceLogs = 1 };
enum ResourceLogs : protozero::pbf_tag_type { kResource = 1, kScopeLogs = 2 };
enum Resource : protozero::pbf_tag_type { kResourceAttributes = 1 };
enum ScopeLogs : protozero::pbf_tag_type { kScope = 1, kLogRecords = 2 };
enum Scope : protozero::pbf_tag_type { kScopeName = 1 };
enum LogRecord : protozero::pbf_tag_type {
  kTimeUnixNano = 1,
  kAttributes = 6,
  kObservedTimeUnixNano = 11,
  kEventName = 12,
};
enum KeyValue : protozero::pbf_tag_type { kKey = 1, kValue = 2 };
enum AnyValue : protozero::pbf_tag_type { kString = 1, kBool = 2, kInt = 3, kDouble = 4 };

// Writes each member as an attribute, field number `tag` of the message that `parent` writes.
class ProtobufAttributes {
 public:
  ProtobufAttributes(pbf_writer& parent, protozero::pbf_tag_type tag)
      : parent_(parent), tag_(tag) {}

  void text(std::string_view key, std::string_view value) {
    attribute(key, [&](pbf_writer& any) { any.add_string(kString, value.data(), value.size()); });
  }
  void boolean(std::string_view key, bool value) {
    attribute(key, [&](pbf_writer& any) { any.add_bool(kBool, value); });
  }
  void integer(std::string_view key, int64_t value) {
    attribute(key, [&](pbf_writer& any) { any.add_int64(kInt, value); });
  }
  void largeInteger(std::string_view key, std::string_view digits) { text(key, digits); }
  void floating(std::string_view key, double value, std::string_view /*digits*/) {
    attribute(key, [&](pbf_writer& any) { any.add_double(kDouble, value); });
  }
  // An empty value stands there in JSON, too. A nested writer would leave the field out.
  void nothing(std::string_view key) {
    pbf_writer pair(parent_, tag_);
    pair.add_string(kKey, key.data(), key.size());
    pair.add_message(kValue, std::string{});
  }

 private:
  void attribute(std::string_view key, auto&& writeValue) {
    pbf_writer pair(parent_, tag_);
    pair.add_string(kKey, key.data(), key.size());
    pbf_writer any(pair, kValue);
    writeValue(any);
  }

  pbf_writer& parent_;
  const protozero::pbf_tag_type tag_;
};

// The bytes of a field that holds `size` bytes. Tags below 16 have one byte.
size_t fieldSize(size_t size) {
  return 1 + static_cast<size_t>(protozero::length_of_varint(size)) + size;
}

class OtlpProtobufEncoder final : public Encoder {
 public:
  explicit OtlpProtobufEncoder(const Resources& resources)
      : resources_{resourceOf(resources.ofRows), resourceOf(resources.ofHealth)} {
    pbf_writer(scope_).add_string(kScopeName, kOtlpScope);
  }

  std::string_view contentType() const override { return "application/x-protobuf"; }
  std::optional<std::string> record(const SpooledEvent& event, std::string_view uid) const override;
  std::string body(std::span<const OutgoingRecord> records) const override;
  std::optional<PartialSuccess> readSuccess(std::string_view mediaType,
                                            std::string_view body) const override {
    return readOtlpSuccess(mediaType, body);
  }

 private:
  static std::string resourceOf(const ResourceAttributes& attributes) {
    std::string resource;
    pbf_writer writer(resource);
    for (const auto& [name, value] : attributes)
      ProtobufAttributes(writer, kResourceAttributes).text(name, value);
    return resource;
  }
  void appendGroup(const RecordGroup& group, std::string& body) const;

  // All are messages and the same in every body.
  const std::array<std::string, 2> resources_;  // see groupByResource()
  std::string scope_;
};

std::optional<std::string> OtlpProtobufEncoder::record(const SpooledEvent& event,
                                                       std::string_view uid) const {
  std::string out;
  pbf_writer record(out);
  // One text that is not UTF-8 makes receivers refuse the whole request. The payload's texts are:
  // its parser takes no others.
  const std::string name = replaceInvalidUtf8(event.name);
  // An event has only this one time, so both times of the record are equal.
  const uint64_t time = nanosecondsOf(event.time);
  record.add_fixed64(kTimeUnixNano, time);
  ProtobufAttributes attributes(record, kAttributes);
  attributes.text(kUidAttribute, uid);
  attributes.text(kEventNameAttribute, name);
  if (!walkPayload(event.payload, attributes)) return {};
  record.add_fixed64(kObservedTimeUnixNano, time);
  record.add_string(kEventName, name);
  return out;
}

// A message is written behind its length. All lengths are computed first, because a writer that
// learns the length at the end moves the whole body once for each message around it.
void OtlpProtobufEncoder::appendGroup(const RecordGroup& group, std::string& body) const {
  size_t scopeLogs = fieldSize(scope_.size());
  for (const OutgoingRecord* record : group.records) scopeLogs += fieldSize(record->text.size());
  const size_t resourceLogs = fieldSize(group.resource.size()) + fieldSize(scopeLogs);
  const size_t end = body.size() + fieldSize(resourceLogs);
  body.reserve(end);
  {
    pbf_writer request(body);
    pbf_writer outer(request, kResourceLogs, resourceLogs);
    outer.add_message(kResource, group.resource);
    pbf_writer inner(outer, kScopeLogs, scopeLogs);
    inner.add_message(kScope, scope_);
    for (const OutgoingRecord* record : group.records) inner.add_message(kLogRecords, record->text);
  }
  // A receiver would take a wrong length for another message.
  TESSEL_INVARIANT(body.size() == end);
}

std::string OtlpProtobufEncoder::body(std::span<const OutgoingRecord> records) const {
  std::string all;
  for (const RecordGroup& group : groupByResource(records, resources_)) appendGroup(group, all);
  return all;
}

}  // namespace

extern constexpr OutputFormat kOtlpProtobuf{
    "otlp", "http/protobuf", kOtlpLogsPath,
    [](const Resources& resources) -> std::unique_ptr<Encoder> {
      return std::make_unique<OtlpProtobufEncoder>(resources);
    }};

}  // namespace tessel
