// Display names of the platforms.

#include "objects/TesselReporterPlatform.h"

namespace tessel {

namespace {

// In code order.
constexpr std::string_view kNames[] = {"Unknown", "Quarro", "Selvin", "Darrow", "Fennic", "Lumet"};
constexpr uint64_t kCount = std::size(kNames);

}  // namespace

TesselReporterPlatform platformFromName(StringRef name) {
  for (uint64_t code = 1; code < kCount; ++code) {
    if (sameString(name, kNames[code])) return static_cast<TesselReporterPlatform>(code);
  }
  return TesselReporterPlatform::unknown;
}

std::string_view nameForPlatform(TesselReporterPlatform platform) {
  const auto code = static_cast<uint64_t>(platform);
  return kNames[code < kCount ? code : 0];
}

}  // namespace tessel
