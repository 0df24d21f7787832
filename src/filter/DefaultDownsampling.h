// The downsampling that is compiled in, and the filters built from it.
//
// Threads: any thread may ask for a filter. What is built is built once, on first use, and lives as
// long as the process.

#pragma once

#include <memory>
#include <optional>

#include "filter/SubsystemCategoryFilter/TRSubsystemCategoryNameFilter.h"
#include "objects/TesselReporterPlatform.h"

namespace tessel {

const DownsampleConfiguration& defaultQuarroConfiguration();
const DownsampleConfiguration& defaultSelvinConfiguration();

// The process-wide filter of the platform, whose counters every run of the process shares; null for
// a platform without a configuration.
std::shared_ptr<TRSubsystemCategoryNameFilter> defaultFilterForPlatform(
    TesselReporterPlatform platform);

// A filter of its own from the same configuration, with counters at zero; null as above.
std::shared_ptr<TRSubsystemCategoryNameFilter> makeDefaultFilterForPlatform(
    TesselReporterPlatform platform);

}  // namespace tessel
