// PlatformProfile: one table of all that differs between platforms.
//
// A profile names its lists of known strings, so the table stands in the room of the lists.
// Constant data; any thread.

#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "platform/Values.h"
#include "whitelist/WhitelistLists.h"

namespace tessel {

// A caller may pass a code that has no profile. The filter keeps such a code as it is, and
// profileOf() answers with the profile of the unknown platform.
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

// Of the trace points with this subsystem, category and name, every `ratio`-th is reported, until
// `cap` of them were. An empty category or name matches any.
struct DownsampleRow {
  std::string_view subsystem;
  std::string_view category;
  std::string_view name;
  uint64_t cap;
  uint64_t ratio;
};

struct PlatformProfile {
  TesselReporterPlatform platform;
  std::string_view name;                        // for people and on command lines
  std::span<const StringListSource> whitelist;  // the known strings are the union of these lists
  std::span<const DownsampleRow> downsampling;  // empty: nothing is downsampled
  bool hasPerfLoggingRule = false;              // see isPerfLoggingOperation()
  bool logsEveryWhitelistLookup = false;
};

// The index is the code of the platform, so the unknown platform comes first.
inline constexpr size_t kPlatformProfiles = 6;
std::span<const PlatformProfile, kPlatformProfiles> platformProfiles();
const PlatformProfile& profileOf(TesselReporterPlatform platform);

// The platform whose display name is exactly `name`; unknown for any other or an absent name.
TesselReporterPlatform platformFromName(StringRef name);
// The display name, "Unknown" for a code without a profile.
inline std::string_view nameForPlatform(TesselReporterPlatform platform) {
  return profileOf(platform).name;
}
// The names that platformFromName() knows: "Quarro, Selvin, ...".
std::string platformNames();

}  // namespace tessel
