// Formats with one flat list of fields per event: newline-delimited JSON for any store that takes
// it, and the text that --dry-run shows.
//
// A line of NDJSON has the time, the event's name and identifier, the attributes of the resource,
// and then the payload's members as they stand in the spool. A column store can take each as a
// column.

#include <algorithm>

#include "forwarder/Otlp.h"
#include "forwarder/PayloadWalk.h"
#include "platform/Json.h"

namespace tessel {

namespace {

constexpr char kTimestamp[] = "timestamp";

// Hands each member on as JSON that stands for its value. `Write` takes the key and the JSON.
template <typename Write>
class JsonMembers {
 public:
  JsonMembers(JsonStyle style, Write write) : style_(style), write_(std::move(write)) {}

  void text(std::string_view key, std::string_view value) {
    std::string json;
    appendJsonString(json, value, style_.forTerminal);
    write_(key, json);
  }
  void boolean(std::string_view key, bool value) { write_(key, value ? "true" : "false"); }
  void integer(std::string_view key, int64_t value) { write_(key, std::to_string(value)); }
  void largeInteger(std::string_view key, std::string_view digits) { write_(key, digits); }
  void floating(std::string_view key, double /*value*/, std::string_view digits) {
    write_(key, digits);
  }
  void nothing(std::string_view key) { write_(key, "null"); }

 private:
  const JsonStyle style_;
  Write write_;
};

class NdjsonEncoder final : public Encoder {
 public:
  explicit NdjsonEncoder(const Resources& resources)
      : ofRows_(membersOf(resources.ofRows)), ofHealth_(membersOf(resources.ofHealth)) {}

  std::string_view contentType() const override { return "application/x-ndjson"; }
  std::optional<std::string> record(const SpooledEvent& event, std::string_view uid) const override;
  std::string body(std::span<const OutgoingRecord> records) const override;
  // Stores of this kind answer with whatever they like. A page is not theirs: it is what a proxy or
  // a network that wants a password shows.
  std::optional<PartialSuccess> readSuccess(std::string_view mediaType,
                                            std::string_view /*body*/) const override {
    if (mediaType == "text/html") return {};
    return PartialSuccess{};
  }

 private:
  // What stands in every line of one resource.
  struct Members {
    std::vector<std::string> names{kTimestamp, kUidAttribute, kEventNameAttribute};
    std::string json;  // of the resource, each member with a comma before it

    bool has(std::string_view name) const { return std::ranges::find(names, name) != names.end(); }
  };

  static void appendName(std::string& line, std::string_view name) {
    line += ',';
    appendJsonString(line, name);
    line += ':';
  }
  static Members membersOf(const ResourceAttributes& resource) {
    Members members;
    for (const auto& [name, value] : resource) {
      if (members.has(name)) continue;
      members.names.push_back(name);
      appendName(members.json, name);
      appendJsonString(members.json, value);
    }
    return members;
  }

  const Members ofRows_, ofHealth_;
};

std::optional<std::string> NdjsonEncoder::record(const SpooledEvent& event,
                                                 std::string_view uid) const {
  std::string line = "{\"timestamp\":\"" + utcText(event.time) + '"';
  appendName(line, kUidAttribute);
  appendJsonString(line, uid);
  appendName(line, kEventNameAttribute);
  appendJsonString(line, event.name);
  const Members& common = isHealth(event) ? ofHealth_ : ofRows_;
  line += common.json;
  JsonMembers members({}, [&](std::string_view key, std::string_view json) {
    // A column of numbers may refuse null, and a member that is not there says the same.
    if (json == "null") return;
    // Two members of one name make many stores refuse the line. The operator can give the resource
    // an attribute that is called like a member of the payload.
    appendName(line, common.has(key) ? "payload." + std::string(key) : std::string(key));
    line += json;
  });
  if (!walkPayload(event.payload, members)) return {};
  line += '}';
  return line;
}

std::string NdjsonEncoder::body(std::span<const OutgoingRecord> records) const {
  size_t size = 0;
  for (const OutgoingRecord& record : records) size += record.text.size() + 1;
  std::string all;
  all.reserve(size);
  for (const OutgoingRecord& record : records) all.append(record.text).append(1, '\n');
  return all;
}

auto fieldsInto(std::string& lines) {
  return JsonMembers({.forTerminal = true}, [&lines](std::string_view key, std::string_view json) {
    lines += "    ";
    // A key needs its quotes only where it would not read as one word.
    std::string quoted;
    appendJsonString(quoted, key, true);
    const bool plain = quoted.size() == key.size() + 2 && !key.empty() &&
                       key.find_first_of(" :") == std::string_view::npos;
    lines.append(plain ? key : quoted).append(": ").append(json).append(1, '\n');
  });
}

// Texts stand as JSON strings in which everything that a terminal obeys is escaped.
class TextEncoder final : public Encoder {
 public:
  explicit TextEncoder(const Resources& resources)
      : resources_{linesOf(resources.ofRows), linesOf(resources.ofHealth)} {}

  std::string_view contentType() const override { return "text/plain"; }
  std::optional<std::string> record(const SpooledEvent& event,
                                    std::string_view uid) const override {
    std::string lines = "  record " + utcText(event.time) + '\n';
    auto fields = fieldsInto(lines);
    fields.text(kUidAttribute, uid);
    fields.text(kEventNameAttribute, event.name);
    if (!walkPayload(event.payload, fields)) return {};
    return lines;
  }
  std::string body(std::span<const OutgoingRecord> records) const override {
    std::string all = "request\n";
    for (const RecordGroup& group : groupByResource(records, resources_)) {
      all.append("  resource\n").append(group.resource);
      for (const OutgoingRecord* record : group.records) all += record->text;
    }
    return all;
  }
  std::optional<PartialSuccess> readSuccess(std::string_view, std::string_view) const override {
    return {};
  }

 private:
  static std::string linesOf(const ResourceAttributes& resource) {
    std::string lines;
    auto fields = fieldsInto(lines);
    for (const auto& [name, value] : resource) fields.text(name, value);
    return lines;
  }

  const std::array<std::string, 2> resources_;  // see groupByResource()
};

}  // namespace

std::unique_ptr<Encoder> makeTextEncoder(const Resources& resources) {
  return std::make_unique<TextEncoder>(resources);
}

extern constexpr OutputFormat kNdjson{"ndjson", "", "",
                                      [](const Resources& resources) -> std::unique_ptr<Encoder> {
                                        return std::make_unique<NdjsonEncoder>(resources);
                                      }};

}  // namespace tessel
