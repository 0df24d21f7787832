// Judging with the filter of the service.
//
// The judge holds no rules. A rule that stood here as well would in time differ from the service's.

#include "tesselctl/judging/Judge.h"

#include <numeric>

namespace tessel::ctl {

uint64_t sumOf(const VerdictCounts& counts) {
  return std::accumulate(counts.begin(), counts.end(), uint64_t{0});
}

Judge::Judge(const JudgedMachine& machine)
    : variant_(std::make_unique<FixedVariant>(machine.internal)),
      filter_(TesselReporterObjectFilter::initWithPlatform(machine.platform, *variant_)) {
  // By default all filters of a process share one downsampling filter and its counters. Two judges
  // in one comparison would use up each other's caps, so each judge gets a downsampling filter of
  // its own.
  filter_->setScnFilter(makeDefaultFilterForPlatform(machine.platform));
}

// A decision points to its entry but does not say where in the tree the entry stands. We walk down
// with the keys of the same query, so we pass the tiers that the filter passed.
std::string Judge::downsamplingScope(const TesselObject& object,
                                     const FilterDecision& decision) const {
  if (decision.downsampleEntry == nullptr || filter_->scnFilter() == nullptr) return {};
  const FilterQuery query(object.subsystem(), object.category(), object.name());
  std::string scope;
  for (const FilterTier* tier = &filter_->scnFilter()->filterTreeRoot();
       tier->downsampleEntry() != decision.downsampleEntry;) {
    const StringRef key = tier->keyForChildren(query);
    // The entry is not on this way, so it is not of this tree. Any name would be wrong.
    if (!key || tier->childTiers() == nullptr) return {};
    const auto child = tier->childTiers()->find(key);
    if (child == tier->childTiers()->end()) return {};
    scope.append(scope.empty() ? "" : "/").append(key.text());
    tier = child->second.get();
  }
  return scope;
}

}  // namespace tessel::ctl
