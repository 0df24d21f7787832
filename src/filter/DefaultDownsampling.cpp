// The default downsampling tables.

#include "filter/DefaultDownsampling.h"

#include <string>

namespace tessel {

namespace {

using FilterReference = std::shared_ptr<TRSubsystemCategoryNameFilter>;

// Empty strings leave their key out.
ConfigurationValue::Dictionary row(const std::string& subsystem, const std::string& category,
                                   const std::string& name, uint64_t cap,
                                   uint64_t downsampleRatio) {
  ConfigurationValue::Dictionary dictionary;
  dictionary["Subsystem"] = {subsystem};
  if (!category.empty()) dictionary["Category"] = {category};
  if (!name.empty()) dictionary["Name"] = {name};
  dictionary["Cap"] = {Number(cap)};
  dictionary["DownsampleRatio"] = {Number(downsampleRatio)};
  return dictionary;
}

// None of these is ever destroyed: a run may still ask while the process exits.

const FilterReference& quarroFilter() {
  static const FilterReference& filter =
      *new FilterReference(makeDefaultFilterForPlatform(TesselReporterPlatform::quarro));
  return filter;
}

const FilterReference& selvinFilter() {
  static const FilterReference& filter =
      *new FilterReference(makeDefaultFilterForPlatform(TesselReporterPlatform::selvin));
  return filter;
}

}  // namespace

const DownsampleConfiguration& defaultQuarroConfiguration() {
  static const DownsampleConfiguration& rows = *new DownsampleConfiguration{
      row("com.vantor.quellan.knowledge", "tessel", "Footprint", 0, 503),
  };
  return rows;
}

const DownsampleConfiguration& defaultSelvinConfiguration() {
  static const DownsampleConfiguration& rows = *new DownsampleConfiguration{
      row("com.vantor.TextInput", "", "", 500, 503),
      row("com.vantor.quellan.knowledge", "tessel", "Footprint", 0, 1),
      row("com.vantor.Mordane.HighSeverity", "SlowNetworkCondition", "CannotSendMailCondition", 0,
          1),
      row("com.vantor.Mordane.MediumSeverity", "HighCPUCondition", "GliskBatchIndex", 0, 1),
  };
  return rows;
}

FilterReference defaultFilterForPlatform(TesselReporterPlatform platform) {
  switch (platform) {
    case TesselReporterPlatform::selvin:
      return selvinFilter();
    case TesselReporterPlatform::quarro:
      return quarroFilter();
    default:
      return nullptr;
  }
}

FilterReference makeDefaultFilterForPlatform(TesselReporterPlatform platform) {
  switch (platform) {
    case TesselReporterPlatform::selvin:
      return TRSubsystemCategoryNameFilter::initWithDictionaryArray(defaultSelvinConfiguration());
    case TesselReporterPlatform::quarro:
      return TRSubsystemCategoryNameFilter::initWithDictionaryArray(defaultQuarroConfiguration());
    default:
      return nullptr;
  }
}

}  // namespace tessel
