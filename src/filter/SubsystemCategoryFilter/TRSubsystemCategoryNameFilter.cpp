// The downsampling tree: its tiers, its entries, and how a configuration becomes a tree.
//
// Each tier is a hash table, so a decision costs at most three lookups, however many rows the
// configuration has. If no row names its subsystem, an object costs one lookup. In a list, such an
// object would be compared with every row.

#include "filter/SubsystemCategoryFilter/TRSubsystemCategoryNameFilter.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <limits>
#include <string_view>
#include <type_traits>

#include "platform/Log.h"

namespace tessel {

namespace {

// Ends the process because a tier lacks an operation, which is a mistake in our own code. Other
// programs read the text with its file and line. Both are therefore constants, which stay the same
// when this source file changes.
[[noreturn]] void failAbstractOperation(const char* function, int line) {
  std::fprintf(stderr, "Assertion failed: (false), function %s, file %s, line %d.\n", function,
               "tessel_reporter/SubsystemCategoryFilter/TRSubsystemCategoryNameFilter", line);
  std::abort();
}

// The number as an unsigned 64-bit integer. A negative integer wraps around, so -1 is a cap that no
// count reaches. A floating-point number loses its fraction. C++ leaves its conversion undefined
// outside the range of the integer, so we clamp it first.
uint64_t unsignedValue(const Number& number) {
  return std::visit(
      [](auto value) -> uint64_t {
        if constexpr (std::is_floating_point_v<decltype(value)>) {
          constexpr auto kAbove = static_cast<double>(std::numeric_limits<uint64_t>::max());
          const auto wide = static_cast<double>(value);
          // Every comparison with NaN is false, so this form also returns 0 for NaN.
          if (!(wide > 0)) return 0;
          return wide >= kAbove ? std::numeric_limits<uint64_t>::max()
                                : static_cast<uint64_t>(wide);
        } else {
          return static_cast<uint64_t>(value);
        }
      },
      number);
}

template <typename T>
const T* valueIn(const ConfigurationValue::Dictionary& row, std::string_view key) {
  const auto found = row.find(key);
  return found == row.end() ? nullptr : std::get_if<T>(&found->second.value);
}

SharedString textIn(const ConfigurationValue::Dictionary& row, std::string_view key) {
  const auto* text = valueIn<std::string>(row, key);
  return text ? SharedString(*text) : SharedString();
}

}  // namespace

std::unique_ptr<TRDownsampleEntry> TRDownsampleEntry::initWithCap(uint64_t cap,
                                                                  uint64_t downsampleRatio) {
  if (downsampleRatio == 0) {
    tesselReporterLog().debug("Tried to create a downsample entry with 0 downsample ratio");
    return nullptr;
  }
  return std::unique_ptr<TRDownsampleEntry>(new TRDownsampleEntry(cap, downsampleRatio));
}

bool TRDownsampleEntry::shouldReportThisTime() {
  const uint64_t seen = eventsSeen() + 1;
  setEventsSeen(seen);
  const uint64_t reported = eventsReported();
  // Only one thread changes the counters, so a separate load and store lose nothing. They are
  // atomic for the threads that read them. An object after the cap was reached still counts as
  // seen, so eventsSeen() tells how many objects there were.
  if (reported >= cap_ || seen % downsampleRatio_ != 0) return false;
  setEventsReported(reported + 1);
  return true;
}

TRDownsampleEntry* FilterTier::entryForQuery(const FilterQuery& query) const {
  const StringRef key = keyForChildren(query);
  // The child is asked first, because the more specific entry decides. If no tier further down has
  // an entry for the query, this tier's own entry applies.
  if (key.present()) {
    const auto child = childTiers_->find(key);
    if (child != childTiers_->end()) {
      if (TRDownsampleEntry* entry = child->second->entryForQuery(query)) return entry;
    }
  }
  return downsampleEntry_.get();
}

void FilterTier::setCap(uint64_t cap, uint64_t downsampleRatio, const FilterQuery& query) {
  const StringRef key = keyForChildren(query);
  if (!key.present()) {
    downsampleEntry_ = TRDownsampleEntry::initWithCap(cap, downsampleRatio);
    return;
  }
  auto child = childTiers_->find(key);
  if (child == childTiers_->end()) child = childTiers_->emplace(key, newChildInstance()).first;
  child->second->setCap(cap, downsampleRatio, query);
}

StringRef FilterTier::keyForChildren(const FilterQuery&) const {
  failAbstractOperation("-[FilterTier keyForChildren:]", 121);
}

std::unique_ptr<FilterTier> FilterTier::newChildInstance() const {
  failAbstractOperation("-[FilterTier newChildInstance]", 127);
}

std::unique_ptr<FilterTier> FilterRootTier::newChildInstance() const {
  return std::make_unique<FilterSubsystemTier>();
}

std::unique_ptr<FilterTier> FilterSubsystemTier::newChildInstance() const {
  return std::make_unique<FilterCategoryTier>();
}

std::unique_ptr<FilterTier> FilterCategoryTier::newChildInstance() const {
  return std::make_unique<FilterNameTier>();
}

std::shared_ptr<TRSubsystemCategoryNameFilter>
TRSubsystemCategoryNameFilter::initWithDictionaryArray(
    const std::optional<DownsampleConfiguration>& configuration) {
  if (!configuration) return nullptr;
  std::shared_ptr<TRSubsystemCategoryNameFilter> filter(new TRSubsystemCategoryNameFilter());
  for (const auto& row : *configuration) {
    if (!filter->addRow(row)) return nullptr;
  }
  return filter;
}

bool TRSubsystemCategoryNameFilter::addRow(const ConfigurationValue::Dictionary& row) {
  const SharedString subsystem = textIn(row, "Subsystem");
  if (!subsystem.present()) {
    tesselReporterLog().debug("Missing required subsystem");
    return false;
  }
  const auto* cap = valueIn<Number>(row, "Cap");
  if (cap == nullptr) {
    tesselReporterLog().debug("Missing required cap");
    return false;
  }
  const auto* ratio = valueIn<Number>(row, "DownsampleRatio");
  if (ratio == nullptr) {
    tesselReporterLog().debug("Missing required downsample ratio");
    return false;
  }
  addEntryWithSubsystem(subsystem, textIn(row, "Category"), textIn(row, "Name"),
                        unsignedValue(*cap), unsignedValue(*ratio));
  return true;
}

bool TRSubsystemCategoryNameFilter::shouldReportObject(const TesselObject& object) {
  TRDownsampleEntry* entry = downsampleEntryForObject(object);
  return entry == nullptr || entry->shouldReportThisTime();
}

TRDownsampleEntry* TRSubsystemCategoryNameFilter::downsampleEntryForObject(
    const TesselObject& object) const {
  return filterTreeRoot_->entryForQuery(
      FilterQuery(object.subsystem(), object.category(), object.name()));
}

void TRSubsystemCategoryNameFilter::addEntryWithSubsystem(StringRef subsystem, StringRef category,
                                                          StringRef name, uint64_t cap,
                                                          uint64_t downsampleRatio) {
  filterTreeRoot_->setCap(cap, downsampleRatio, FilterQuery(subsystem, category, name));
}

std::optional<DownsampleConfiguration> defaultConfigurationForPlatform(
    TesselReporterPlatform platform) {
  DownsampleConfiguration rows;
  for (const DownsampleRow& row : profileOf(platform).downsampling) {
    auto& dictionary = rows.emplace_back();
    dictionary["Subsystem"] = {std::string(row.subsystem)};
    if (!row.category.empty()) dictionary["Category"] = {std::string(row.category)};
    if (!row.name.empty()) dictionary["Name"] = {std::string(row.name)};
    dictionary["Cap"] = {Number(row.cap)};
    dictionary["DownsampleRatio"] = {Number(row.ratio)};
  }
  return rows.empty() ? std::nullopt : std::optional(std::move(rows));
}

std::shared_ptr<TRSubsystemCategoryNameFilter> defaultFilterForPlatform(
    TesselReporterPlatform platform) {
  using Filters = std::vector<std::shared_ptr<TRSubsystemCategoryNameFilter>>;
  // We never destroy the filters: a run may still use one while another thread ends the process.
  // All are made at the first call, so that later calls only read and need no lock.
  static const Filters& filters = *new Filters([] {
    Filters made;
    for (const PlatformProfile& profile : platformProfiles())
      made.push_back(makeDefaultFilterForPlatform(profile.platform));
    return made;
  }());
  return filters[static_cast<size_t>(profileOf(platform).platform)];
}

std::shared_ptr<TRSubsystemCategoryNameFilter> makeDefaultFilterForPlatform(
    TesselReporterPlatform platform) {
  return TRSubsystemCategoryNameFilter::initWithDictionaryArray(
      defaultConfigurationForPlatform(platform));
}

}  // namespace tessel
