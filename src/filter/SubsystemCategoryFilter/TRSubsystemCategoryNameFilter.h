// TRSubsystemCategoryNameFilter: limits how many trace objects of a subsystem, category and name
// are reported.
//
//   FilterRootTier --subsystem--> FilterSubsystemTier --category--> FilterCategoryTier
//                                                                 --name--> FilterNameTier
//
// A tier may carry a TRDownsampleEntry. The most specific entry on an object's path through the
// tree decides; an object whose path has none is let through. Once a filter is built, only the
// counters of its entries change, and they count for as long as the filter lives.
//
// Threads: one thread at a time may use a filter. Any thread may read the counters of an entry. A
// lookup copies and hashes no text.

#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <unordered_map>
#include <vector>

#include "objects/TesselObject.h"
#include "platform/Analytics.h"
#include "platform/Values.h"
#include "whitelist/PlatformProfile.h"

namespace tessel {

// The path of an object through the tree. Borrows its strings; each may be absent.
class FilterQuery {
 public:
  FilterQuery(StringRef subsystem, StringRef category, StringRef name)
      : subsystem_(subsystem), category_(category), name_(name) {}

  StringRef subsystem() const { return subsystem_; }
  StringRef category() const { return category_; }
  StringRef name() const { return name_; }

 private:
  StringRef subsystem_;
  StringRef category_;
  StringRef name_;
};

// Numbers its objects from 1 and lets through those whose number is a multiple of the ratio, until
// it has let `cap` objects through.
class TRDownsampleEntry {
 public:
  // Null for a ratio of 0, which is also logged. A cap of 0 lets nothing through.
  static std::unique_ptr<TRDownsampleEntry> initWithCap(uint64_t cap, uint64_t downsampleRatio);

  // Whether the next object is let through. Counts it as seen and, if so, as reported.
  bool shouldReportThisTime();

  // Objects that this entry was asked about.
  uint64_t eventsSeen() const { return eventsSeen_.load(std::memory_order_relaxed); }
  void setEventsSeen(uint64_t count) { eventsSeen_.store(count, std::memory_order_relaxed); }
  // Objects that this entry let through.
  uint64_t eventsReported() const { return eventsReported_.load(std::memory_order_relaxed); }
  void setEventsReported(uint64_t count) {
    eventsReported_.store(count, std::memory_order_relaxed);
  }
  uint64_t cap() const { return cap_; }
  uint64_t downsampleRatio() const { return downsampleRatio_; }

 private:
  TRDownsampleEntry(uint64_t cap, uint64_t downsampleRatio)
      : cap_(cap), downsampleRatio_(downsampleRatio) {}

  std::atomic<uint64_t> eventsSeen_{0};
  std::atomic<uint64_t> eventsReported_{0};
  const uint64_t cap_;
  const uint64_t downsampleRatio_;  // never 0
};

// A node of the tree. Owns its children and its entry.
class FilterTier {
 public:
  struct Hash {
    using is_transparent = void;
    size_t operator()(StringRef text) const { return text.hash(); }
  };
  struct Equal {
    using is_transparent = void;
    bool operator()(StringRef a, StringRef b) const { return sameString(a, b); }
  };
  using ChildTiers = std::unordered_map<SharedString, std::unique_ptr<FilterTier>, Hash, Equal>;

  FilterTier(const FilterTier&) = delete;
  FilterTier& operator=(const FilterTier&) = delete;
  virtual ~FilterTier() = default;

  // The most specific entry for the query, in this tier or below it; null if there is none. The
  // pointer is valid until setCap() replaces the entry.
  TRDownsampleEntry* entryForQuery(const FilterQuery& query) const;
  // Follows the strings of the query down the tree and stops at the first absent one. The tier
  // there gets a new entry with counters at 0 in place of its old one. With a ratio of 0 it gets
  // none.
  void setCap(uint64_t cap, uint64_t downsampleRatio, const FilterQuery& query);

  // The string of the query that chooses the child; absent in a leaf. Every tier overrides this;
  // the version of the base class ends the process.
  virtual StringRef keyForChildren(const FilterQuery& query) const;
  // A new tier of the next level. A leaf has no next level, so there this ends the process.
  virtual std::unique_ptr<FilterTier> newChildInstance() const;

  // Null in a leaf.
  ChildTiers* childTiers() const { return childTiers_.get(); }
  void setChildTiers(std::unique_ptr<ChildTiers> tiers) { childTiers_ = std::move(tiers); }
  // May be null.
  TRDownsampleEntry* downsampleEntry() const { return downsampleEntry_.get(); }
  void setDownsampleEntry(std::unique_ptr<TRDownsampleEntry> entry) {
    downsampleEntry_ = std::move(entry);
  }

 protected:
  explicit FilterTier(std::unique_ptr<ChildTiers> childTiers)
      : childTiers_(std::move(childTiers)) {}

 private:
  std::unique_ptr<ChildTiers> childTiers_;
  std::unique_ptr<TRDownsampleEntry> downsampleEntry_;
};

class FilterRootTier final : public FilterTier {
 public:
  FilterRootTier() : FilterTier(std::make_unique<ChildTiers>()) {}
  StringRef keyForChildren(const FilterQuery& query) const override { return query.subsystem(); }
  std::unique_ptr<FilterTier> newChildInstance() const override;
};

class FilterSubsystemTier final : public FilterTier {
 public:
  FilterSubsystemTier() : FilterTier(std::make_unique<ChildTiers>()) {}
  StringRef keyForChildren(const FilterQuery& query) const override { return query.category(); }
  std::unique_ptr<FilterTier> newChildInstance() const override;
};

class FilterCategoryTier final : public FilterTier {
 public:
  FilterCategoryTier() : FilterTier(std::make_unique<ChildTiers>()) {}
  StringRef keyForChildren(const FilterQuery& query) const override { return query.name(); }
  std::unique_ptr<FilterTier> newChildInstance() const override;
};

class FilterNameTier final : public FilterTier {
 public:
  FilterNameTier() : FilterTier(nullptr) {}
  StringRef keyForChildren(const FilterQuery&) const override { return {}; }
};

// Each dictionary describes one entry. "Subsystem", "Cap" and "DownsampleRatio" are required;
// "Category" and "Name" are optional. A value of the wrong type counts as absent.
using DownsampleConfiguration = std::vector<ConfigurationValue::Dictionary>;

class TRSubsystemCategoryNameFilter {
 public:
  // Null if the configuration is absent, or if a row lacks a required value. Such a row is logged,
  // and the rows after it are not read. A row with a ratio of 0 makes no entry.
  static std::shared_ptr<TRSubsystemCategoryNameFilter> initWithDictionaryArray(
      const std::optional<DownsampleConfiguration>& configuration);

  // True if the object may be reported. Advances the counters of the entry that applies to it.
  bool shouldReportObject(const TesselObject& object);
  // The entry that applies to the object; null if there is none. Changes no counter. The pointer is
  // valid until addEntryWithSubsystem() replaces the entry.
  TRDownsampleEntry* downsampleEntryForObject(const TesselObject& object) const;
  // Puts a new entry at this path of the tree. Any of the strings may be absent. See
  // FilterTier::setCap().
  void addEntryWithSubsystem(StringRef subsystem, StringRef category, StringRef name, uint64_t cap,
                             uint64_t downsampleRatio);

  FilterTier& filterTreeRoot() const { return *filterTreeRoot_; }

 private:
  TRSubsystemCategoryNameFilter() : filterTreeRoot_(std::make_unique<FilterRootTier>()) {}
  bool addRow(const ConfigurationValue::Dictionary& row);

  const std::unique_ptr<FilterTier> filterTreeRoot_;
};

// The downsampling rows of the platform's profile; absent if the profile has none.
std::optional<DownsampleConfiguration> defaultConfigurationForPlatform(
    TesselReporterPlatform platform);

// The filter with the platform's default configuration. All runs of the process share it, so a cap
// holds for the life of the process and not for one run. Null if the platform has no such
// configuration. Any thread may ask.
std::shared_ptr<TRSubsystemCategoryNameFilter> defaultFilterForPlatform(
    TesselReporterPlatform platform);

// A new filter with the same configuration and with all counters at 0. Null if the platform has no
// such configuration.
std::shared_ptr<TRSubsystemCategoryNameFilter> makeDefaultFilterForPlatform(
    TesselReporterPlatform platform);

}  // namespace tessel
