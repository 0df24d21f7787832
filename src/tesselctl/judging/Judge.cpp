// A filter of the service with counters of its own.

#include "tesselctl/judging/Judge.h"

#include <numeric>

namespace tessel::ctl {

uint64_t sumOf(const VerdictCounts& counts) {
  return std::accumulate(counts.begin(), counts.end(), uint64_t{0});
}

Judge::Judge(const JudgedMachine& machine)
    : variant_(std::make_unique<FixedVariant>(machine.internal)),
      filter_(TesselReporterObjectFilter::initWithPlatform(machine.platform, *variant_)) {
  // The filter that all of a process share keeps counting. Two judges in one comparison must not
  // use up each other's caps, so each gets a downsampling filter of its own.
  filter_->setScnFilter(makeDefaultFilterForPlatform(machine.platform));
}

// A decision names its entry but not the way there. We walk down the tree as the filter did.
std::string Judge::downsamplingScope(const TesselObject& object,
                                     const FilterDecision& decision) const {
  if (decision.downsampleEntry == nullptr || filter_->scnFilter() == nullptr) return {};
  const FilterQuery query(object.subsystem(), object.category(), object.name());
  std::string scope;
  for (const FilterTier* tier = &filter_->scnFilter()->filterTreeRoot();
       tier->downsampleEntry() != decision.downsampleEntry;) {
    const StringRef key = tier->keyForChildren(query);
    if (!key || tier->childTiers() == nullptr) return {};
    const auto child = tier->childTiers()->find(key);
    if (child == tier->childTiers()->end()) return {};
    scope.append(scope.empty() ? "" : "/").append(key.text());
    tier = child->second.get();
  }
  return scope;
}

}  // namespace tessel::ctl
