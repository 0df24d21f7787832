// What OTLP over HTTP says in both of its encodings.

#pragma once

#include <optional>
#include <string_view>

#include "forwarder/Encoder.h"

namespace tessel {

inline constexpr char kOtlpLogsPath[] = "/v1/logs";
inline constexpr char kOtlpScope[] = "com.vantor.tessel.tessel_reporter";

// The names of the two attributes that we add to a payload. A collector from before June 2025 drops
// the field of a record that holds the event's name. Without the second, the two events of a trace
// object would look the same behind such a collector.
inline constexpr char kUidAttribute[] = "log.record.uid";
inline constexpr char kEventNameAttribute[] = "event.name";

// Encoder::readSuccess() of both encodings. A receiver may answer in either one, whatever we sent.
std::optional<PartialSuccess> readOtlpSuccess(std::string_view mediaType, std::string_view body);

}  // namespace tessel
