// The profiles of the platforms.
//
// The compiler builds these tables. A profile can therefore be asked for at any time, even before
// main() begins and while the process ends.

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
// These platforms have no list of their own, so every text outside of the common list fails their
// whitelist.
constexpr StringListSource kCommonLists[] = {commonWhitelistValues};

// A cap of 0 lets no trace point through. Its ratio then decides nothing, but it must not be 0:
// such a row makes no entry, and without an entry every trace point passes.
constexpr DownsampleRow kQuarroRows[] = {
    {"com.vantor.quellan.knowledge", "tessel", "Footprint", 0, 503},
};
// 503 is prime. If the trace points repeat a sequence of up to 500, the 500 samples therefore reach
// every place in the sequence. The cap of 500 is reached after 251,500 trace points.
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

// profileOf() uses the code as the index, so a row at the wrong place would give a platform the
// lists of another.
static_assert([] {
  for (size_t code = 0; code < kProfiles.size(); ++code) {
    if (static_cast<size_t>(kProfiles[code].platform) != code) return false;
  }
  return true;
}());

}  // namespace

std::span<const PlatformProfile, kPlatformProfiles> platformProfiles() { return kProfiles; }

const PlatformProfile& profileOf(TesselReporterPlatform platform) {
  // A code without a profile must get the strictest one: row 0 knows no string.
  const auto code = static_cast<uint64_t>(platform);
  return kProfiles[code < kProfiles.size() ? code : 0];
}

TesselReporterPlatform platformFromName(StringRef name) {
  // An absent name equals none of the names, so the search fails and the platform is unknown.
  const auto* const found = std::ranges::find_if(
      kProfiles, [&](const PlatformProfile& profile) { return sameString(name, profile.name); });
  return found == kProfiles.end() ? Platform::unknown : found->platform;
}

std::string platformNames() {
  std::string names;
  // The list tells people which names they may pass, and "Unknown" is no platform to choose.
  for (const PlatformProfile& profile : platformProfiles().subspan<1>())
    names.append(names.empty() ? "" : ", ").append(profile.name);
  return names;
}

}  // namespace tessel
