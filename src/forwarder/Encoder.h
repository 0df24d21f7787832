// The forwarder's output formats: the role Encoder, the list of those that exist, and the batches
// that they encode.
//
// A new format is a file that defines an OutputFormat, and its line in the list in Encoder.cpp.
// Nothing else knows which format is sent. Encoders are immutable; any thread may use them.

#pragma once

#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "statora/ForwarderState.h"

namespace tessel {

// What all records of this machine have in common. Neither its host name nor its machine id.
struct ResourceFacts {
  std::string serviceVersion;
  std::string osName;
  std::string osVersion;
  std::string hostArch;                   // as OpenTelemetry names it: amd64, arm64, ...
  std::optional<std::string> instanceId;  // absent unless the operator asked for one
};

// The facts of this machine, from its os-release file and its kernel. With `withInstanceId` they
// hold an identifier of this machine that is made for this program: nobody can compute the machine
// id from it.
ResourceFacts readResourceFacts(const std::string& osReleasePath, bool withInstanceId);

// A row of the spool and the record that it becomes.
struct OutgoingRecord {
  SpooledEvent event;
  std::string text;
};

// What the answer to a request that was accepted says about its records.
struct PartialSuccess {
  uint64_t rejected = 0;  // records that the collector took and threw away
  std::string message;    // its reason, as it stands in the answer
};

class Encoder {
 public:
  virtual ~Encoder() = default;
  // The media type of a body.
  virtual std::string_view contentType() const = 0;
  // One record. The same row always yields the same bytes, because a collector may see it twice and
  // tells it by them. Absent if the payload is not a flat JSON object.
  virtual std::optional<std::string> record(const SpooledEvent& event,
                                            std::string_view spoolId) const = 0;
  // The body of the request that carries `records`.
  virtual std::string body(std::span<const OutgoingRecord> records) const = 0;
  // Reads the body of an answer. One that cannot be understood rejects nothing.
  virtual PartialSuccess partialSuccess(std::string_view answer) const = 0;
};

struct OutputFormat {
  std::string_view protocol;  // its name in OTEL_EXPORTER_OTLP_PROTOCOL
  std::string_view path;      // where a collector takes it, below the collector's address
  std::unique_ptr<Encoder> (*makeEncoder)(const ResourceFacts& facts);
};

// Every format; the first is sent unless the settings name another.
std::span<const OutputFormat* const> outputFormats();

// The content of one request.
struct Batch {
  std::vector<OutgoingRecord> records;
  std::vector<SpooledEvent> malformed;  // rows that cannot become records
  int64_t lastId = 0;                   // the highest id in both lists
};

// Takes events from the front until their records hold `maxBytes`; the rest is left for the next
// batch. One record is taken however long it is, or it would never leave. REQUIRES: `events` is not
// empty.
Batch cutBatch(std::vector<SpooledEvent> events, const Encoder& encoder, std::string_view spoolId,
               size_t maxBytes);

}  // namespace tessel
