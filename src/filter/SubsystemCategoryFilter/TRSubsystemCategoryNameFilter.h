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
// Threads: one at a time uses a filter; any thread may read the counters of an entry. Asking copies
// and hashes no text.

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

// Lets through each object whose running number is a multiple of the ratio, up to a cap.
class TRDownsampleEntry {
 public:
  // Null and a log line for a ratio of 0. A cap of 0 lets nothing through.
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

  // The entry for the query in this tier or below; null if there is none. Borrowed until replaced.
  TRDownsampleEntry* entryForQuery(const FilterQuery& query) const;
  // Puts a fresh entry into the tier where the query's first string is absent. It replaces the
  // entry there; a ratio of 0 leaves none.
  void setCap(uint64_t cap, uint64_t downsampleRatio, const FilterQuery& query);

  // The string of the query that chooses the child; absent in a leaf. Stops the process in a class
  // that does not define it.
  virtual StringRef keyForChildren(const FilterQuery& query) const;
  // A tier of the next level. Stops the process in a leaf.
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

// One dictionary per entry: "Subsystem", "Cap" and "DownsampleRatio", optionally "Category" and
// "Name". A value of the wrong type is taken for absent.
using DownsampleConfiguration = std::vector<ConfigurationValue::Dictionary>;

class TRSubsystemCategoryNameFilter {
 public:
  // Null for an absent configuration. Null and a log line for a row that lacks a required value;
  // the rows after it are not read. A row with a ratio of 0 makes no entry.
  static std::shared_ptr<TRSubsystemCategoryNameFilter> initWithDictionaryArray(
      const std::optional<DownsampleConfiguration>& configuration);

  // True when the object may be reported. Advances the counters of the entry that applies to it.
  bool shouldReportObject(const TesselObject& object);
  // The entry that applies to the object; null if there is none. Borrowed until replaced.
  TRDownsampleEntry* downsampleEntryForObject(const TesselObject& object) const;
  // Puts a fresh entry at the path; its strings may be absent. See FilterTier::setCap().
  void addEntryWithSubsystem(StringRef subsystem, StringRef category, StringRef name, uint64_t cap,
                             uint64_t downsampleRatio);

  FilterTier& filterTreeRoot() const { return *filterTreeRoot_; }

 private:
  TRSubsystemCategoryNameFilter() : filterTreeRoot_(std::make_unique<FilterRootTier>()) {}
  bool addRow(const ConfigurationValue::Dictionary& row);

  const std::unique_ptr<FilterTier> filterTreeRoot_;
};

// The downsampling of the platform's profile; absent if that downsamples nothing.
std::optional<DownsampleConfiguration> defaultConfigurationForPlatform(
    TesselReporterPlatform platform);

// The filter made of it that all runs of the process share, because a cap holds for the process:
// its counters go on from run to run. Null where there is no configuration. Any thread may ask.
std::shared_ptr<TRSubsystemCategoryNameFilter> defaultFilterForPlatform(
    TesselReporterPlatform platform);

// A filter of its own from the same configuration, with counters at zero; null as above.
std::shared_ptr<TRSubsystemCategoryNameFilter> makeDefaultFilterForPlatform(
    TesselReporterPlatform platform);

}  // namespace tessel
