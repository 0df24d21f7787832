// OTLP/HTTP bodies in JSON: one log record per event.
//
// A record has the event's name as `eventName`, its time, and the payload's members as flat
// attributes in payload order, of the kind that they have there: strings, booleans, integers as
// decimal strings, other numbers as doubles in the very digits of the spool. An unsigned integer
// above 2^63-1, which OTLP has no kind for, is a string. Attribute `log.record.uid` is made of the
// spool's identifier and the row's, so that a record that arrives twice can be told from a new one;
// the body for a row is the same each time.

#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "forwarder/Batch.h"
#include "statora/ForwarderState.h"

namespace tessel {

// What the records of this machine have in common. No host name and no machine id.
struct ResourceFacts {
  std::string serviceVersion;
  std::string osName;
  std::string osVersion;
  std::string hostArch;                   // as OpenTelemetry names it: amd64, arm64, ...
  std::optional<std::string> instanceId;  // only where the operator asked for one
};

// The machine's, by os-release file and kernel.
ResourceFacts readResourceFacts(const std::string& osReleasePath);
// An identifier of this machine for this program, from which the machine id cannot be computed.
std::optional<std::string> applicationInstanceId();

// The log record; nothing where the payload is not a flat JSON object.
std::optional<std::string> otlpRecord(const SpooledEvent& event, std::string_view spoolId);

// Puts records into request bodies.
class OtlpBody {
 public:
  explicit OtlpBody(const ResourceFacts& facts);
  std::string around(std::span<const OutgoingRecord> records) const;

 private:
  std::string head_;
};

}  // namespace tessel
