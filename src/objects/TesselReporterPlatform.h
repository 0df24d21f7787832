// TesselReporterPlatform: the platforms that the service can be built for.
//
// Plain codes and names; any thread may ask.

#pragma once

#include <cstdint>
#include <string_view>

#include "platform/SharedString.h"

namespace tessel {

// A code above `lumet` is no platform of the table, but is carried along as it is.
enum class TesselReporterPlatform : uint64_t {
  unknown = 0,
  quarro = 1,
  selvin = 2,
  darrow = 3,
  fennic = 4,
  lumet = 5,
};

// The platform that this build is for; fixed when the service is built.
constexpr TesselReporterPlatform currentPlatform() { return TesselReporterPlatform::selvin; }

// The platform whose display name is exactly `name`; unknown for any other or an absent name.
TesselReporterPlatform platformFromName(StringRef name);

// The display name, "Unknown" for a code outside the table.
std::string_view nameForPlatform(TesselReporterPlatform platform);

}  // namespace tessel
