// PlatformProfile: what is different from platform to platform, in one table.
//
// It stands beside the whitelist because that is the lowest room that knows the lists which a
// profile names. Constant data; any thread.

#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "platform/Values.h"
#include "whitelist/WhitelistLists.h"

namespace tessel {

// Codes are numbers of an interface, so a code without a profile may turn up. It is carried along
// unchanged and has the profile of the unknown platform.
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

// Of the trace points with this path, each `ratio`-th is reported, `cap` of them at most. An empty
// category or name stands for any.
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
  std::span<const StringListSource> whitelist;  // together the known strings
  std::span<const DownsampleRow> downsampling;  // empty: nothing is downsampled
  bool hasPerfLoggingRule = false;              // see isPerfLoggingOperation()
  bool logsEveryWhitelistLookup = false;
};

// By code: unknown first, then every platform.
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
