// The forwarder's output formats: the role Encoder, the list of formats, and the batches that an
// encoder turns into requests.
//
// To add a format, write a file that defines an OutputFormat and add it to the list in Encoder.cpp.
// No other code knows the formats. Encoders are immutable; any thread may use them.

#pragma once

#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "statora/ForwarderState.h"

namespace tessel {

// The facts that all records of this machine share. The host name and the machine id are left out
// on purpose.
struct ResourceFacts {
  std::string serviceVersion;
  std::string osName;
  std::string osVersion;
  std::string hostArch;                   // as OpenTelemetry names it: amd64, arm64, ...
  std::optional<std::string> instanceId;  // absent unless the operator asked for one
};

// The facts of this machine, from its os-release file and its kernel. `withInstanceId` adds an
// identifier of the machine that only this program uses. Nobody can compute the machine id from it.
ResourceFacts readResourceFacts(const std::string& osReleasePath, bool withInstanceId);

// A row of the spool and the record that it becomes.
struct OutgoingRecord {
  SpooledEvent event;
  std::string text;
};

// What the answer to an accepted request says about its records.
struct PartialSuccess {
  uint64_t rejected = 0;  // records that the collector took and threw away
  std::string message;    // its reason, as it stands in the answer
};

class Encoder {
 public:
  virtual ~Encoder() = default;
  // The media type of a body.
  virtual std::string_view contentType() const = 0;
  // One record. The same row always gives the same bytes: a collector may receive it twice and must
  // be able to recognise it. Absent if the payload is not a flat JSON object.
  virtual std::optional<std::string> record(const SpooledEvent& event,
                                            std::string_view spoolId) const = 0;
  // The body of the request that carries `records`.
  virtual std::string body(std::span<const OutgoingRecord> records) const = 0;
  // Reads an answer with a status of success. Absent if it is no answer of this protocol: then
  // somebody else answered, and nothing says that a collector has the records. `mediaType` is in
  // small letters and without parameters; it is empty if the answer names none.
  virtual std::optional<PartialSuccess> readSuccess(std::string_view mediaType,
                                                    std::string_view body) const = 0;
};

struct OutputFormat {
  std::string_view format;    // its name in TESSEL_FORWARD_FORMAT
  std::string_view protocol;  // its name in OTEL_EXPORTER_OTLP_PROTOCOL; empty if it is not OTLP
  std::string_view path;      // what is added to the collector's address; empty: nothing
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

// Takes events from the front until their records hold `maxBytes`, and leaves the others for the
// next batch. The first record is taken however long it is, because it would never leave otherwise.
// REQUIRES: `events` is not empty.
Batch cutBatch(std::vector<SpooledEvent> events, const Encoder& encoder, std::string_view spoolId,
               size_t maxBytes);

}  // namespace tessel
