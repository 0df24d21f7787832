// The profiles of the platforms.
//
// The tables are constants, not objects with constructors, so a profile can be asked for at any
// time, even while the process starts or ends.

#include "whitelist/PlatformProfile.h"

#include <algorithm>
#include <array>

namespace tessel {

namespace {

using Platform = TesselReporterPlatform;

constexpr StringListSource kQuarroLists[] = {perfLoggingComponentNames, perfLoggingActionNames,
                                             desktopBundleIdentifiers, fileSystemScanValues,
                                             commonWhitelistValues};
constexpr StringListSource kSelvinLists[] = {
    launchSourceValues,         cameraValues,           shareActivityTypes,
    extensionBundleIdentifiers, periodViewValues,       sizeValues,
    mailAccountKindValues,      generationSourceValues, commonWhitelistValues};
// Platforms without lists of their own know only what all know.
constexpr StringListSource kCommonLists[] = {commonWhitelistValues};

// A cap of 0 switches a trace point off; its ratio then only has to be one that makes an entry.
constexpr DownsampleRow kQuarroRows[] = {
    {"com.vantor.quellan.knowledge", "tessel", "Footprint", 0, 503},
};
// 503 is prime, so the sample walks through every step of a writer that repeats a sequence.
constexpr DownsampleRow kSelvinRows[] = {
    {"com.vantor.TextInput", "", "", 500, 503},
    {"com.vantor.quellan.knowledge", "tessel", "Footprint", 0, 1},
    {"com.vantor.Mordane.HighSeverity", "SlowNetworkCondition", "CannotSendMailCondition", 0, 1},
    {"com.vantor.Mordane.MediumSeverity", "HighCPUCondition", "GliskBatchIndex", 0, 1},
};

constexpr std::array<PlatformProfile, kPlatformProfiles> kProfiles = {{
    {Platform::unknown, "Unknown", {}, {}},
    {Platform::quarro, "Quarro", kQuarroLists, kQuarroRows, true},
    {Platform::selvin, "Selvin", kSelvinLists, kSelvinRows},
    {Platform::darrow, "Darrow", kCommonLists, {}},
    {Platform::fennic, "Fennic", kCommonLists, {}},
    {Platform::lumet, "Lumet", {}, {}, false, true},
}};

// profileOf() takes the code for the place in the table.
static_assert([] {
  for (size_t code = 0; code < kProfiles.size(); ++code) {
    if (static_cast<size_t>(kProfiles[code].platform) != code) return false;
  }
  return true;
}());

}  // namespace

std::span<const PlatformProfile, kPlatformProfiles> platformProfiles() { return kProfiles; }

const PlatformProfile& profileOf(TesselReporterPlatform platform) {
  const auto code = static_cast<uint64_t>(platform);
  return kProfiles[code < kProfiles.size() ? code : 0];
}

TesselReporterPlatform platformFromName(StringRef name) {
  // Five short names: a map would cost more than it saves.
  const auto* const found = std::ranges::find_if(
      kProfiles, [&](const PlatformProfile& profile) { return sameString(name, profile.name); });
  return found == kProfiles.end() ? Platform::unknown : found->platform;
}

std::string platformNames() {
  std::string names;
  // The first profile is that of the unknown platform, which nobody can ask for by name.
  for (const PlatformProfile& profile : platformProfiles().subspan<1>())
    names.append(names.empty() ? "" : ", ").append(profile.name);
  return names;
}

}  // namespace tessel
