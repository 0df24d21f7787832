// The forwarder's output formats: the role Encoder, the list of formats, what every format says of
// a record, and the batches that an encoder turns into requests.
//
// To add a format, write a file that defines an OutputFormat and add it to the list in Encoder.cpp.
// No other code knows the formats. Encoders are immutable; any thread may use them.

#pragma once

#include <array>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/SipHash.h"
#include "statora/ForwarderState.h"

namespace tessel {

// What all records of this machine have in common: names by OpenTelemetry's conventions and values.
using ResourceAttributes = std::vector<std::pair<std::string, std::string>>;

// A health record must say which machine it is about. A record about the use of a program must not,
// unless the operator wants it.
struct Resources {
  ResourceAttributes ofRows;
  ResourceAttributes ofHealth;
};

// The attributes of this machine, from its os-release file and its kernel. `given` by the operator
// comes after them: a member of the same name replaces the fact, and an empty value removes it.
// Attributes that name the machine, and an identifier of it that only this program uses, stand with
// health records, and with the others only if `rowsNameMachine`. Nobody can compute the machine id
// from that identifier.
Resources readResources(const std::string& osReleasePath, const ResourceAttributes& given,
                        bool rowsNameMachine);

// Whether an attribute of this name says which machine it is, by OpenTelemetry's conventions.
bool namesMachine(std::string_view attribute);

// The identifiers of the records of one spool: 32 hexadecimal digits, a hash of a row with a key
// that stays on the machine. So the same row always has the same one, another content has another
// one, and two of them do not show that they come from one spool.
class RecordIds {
 public:
  // `machine` is a secret of this machine; it is empty if it has none. Machines that were cloned
  // from one image have one spool identifier, and this tells them apart.
  RecordIds(std::string_view spoolId, std::string_view machine);
  // Of the spool on this machine. In a container without a machine id the spool's identifier alone
  // is the key.
  static RecordIds ofThisMachine(std::string_view spoolId);

  std::string of(const SpooledEvent& event) const;

 private:
  SipKey key_;
};

// A row of the spool and the record that it becomes.
struct OutgoingRecord {
  SpooledEvent event;
  std::string text;
};

// The records of one resource. A request holds one group or both.
struct RecordGroup {
  const std::string& resource;  // as the encoder writes it
  std::vector<const OutgoingRecord*> records;
};

// Whether the event is a health record.
bool isHealth(const SpooledEvent& event);
// The groups that have records: those of rows with `resources[0]`, those of health with the other.
std::vector<RecordGroup> groupByResource(std::span<const OutgoingRecord> records,
                                         const std::array<std::string, 2>& resources);

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
  // One record, with its identifier. The same row always gives the same bytes: a collector may
  // receive it twice and must be able to recognise it. Absent if the payload is not a flat JSON
  // object.
  virtual std::optional<std::string> record(const SpooledEvent& event,
                                            std::string_view uid) const = 0;
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
  std::unique_ptr<Encoder> (*makeEncoder)(const Resources& resources);
};

// Every format; the first is sent unless the settings name another.
std::span<const OutputFormat* const> outputFormats();

// An encoder for people: the fields of each record as text that is fit for a terminal. Its bodies
// are never sent.
std::unique_ptr<Encoder> makeTextEncoder(const Resources& resources);

// OTLP counts nanoseconds since 1970 without a sign. Times that it cannot say become its nearest.
uint64_t nanosecondsOf(int64_t microseconds);
// "2026-11-23T20:28:35.123456Z". Times outside of the years 1970 to 9999 become the nearest.
std::string utcText(int64_t microseconds);

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
