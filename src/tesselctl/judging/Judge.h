// Judge: what the service would decide about a trace object, and the names of its decisions.
//
// A judge owns a filter of the service. Its downsampling counters begin at zero, as in a service
// that has just started. One thread at a time; the functions are stateless.

#pragma once

#include <algorithm>
#include <array>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "filter/TesselReporterObjectFilter.h"

namespace tessel::ctl {

// A verdict is a classification as it is shown. Every list of verdicts has this order.
inline constexpr auto kVerdictOrder = [] {
  std::array<TesselReporterClassification, kClassifications.size()> order{};
  std::ranges::transform(kClassifications, order.begin(), &ClassificationRow::code);
  return order;
}();

// The name of a verdict on the command line and in JSON.
constexpr std::string_view verdictName(TesselReporterClassification classification) {
  return classificationRow(classification).name;
}

// Trace objects by classification code.
using VerdictCounts = ClassifiedCounts;
uint64_t sumOf(const VerdictCounts& counts);

// The kind of machine that a judge decides for.
struct JudgedMachine {
  TesselReporterPlatform platform = currentPlatform();
  bool internal = false;  // a build with internal diagnostics
};

class Judge {
 public:
  // REQUIRES: machine.platform is not unknown.
  explicit Judge(const JudgedMachine& machine);

  // The decision about the next object. The object is borrowed; the decision points into it and
  // into the judge, and shows the downsampling counters until the next call.
  FilterDecision inspect(const TesselObject& object) {
    return filter_->inspectTesselObject(object);
  }
  // The part of the downsampling table that decided: "com.vantor.TextInput" or
  // "subsystem/category/name". Empty where downsampling was not asked, or where an entry for
  // everything decided.
  std::string downsamplingScope(const TesselObject& object, const FilterDecision& decision) const;

 private:
  struct FixedVariant final : BuildVariant {
    explicit FixedVariant(bool answer) : internal(answer) {}
    bool hasInternalDiagnostics(std::string_view /*subsystem*/) override { return internal; }
    const bool internal;
  };

  // The filter refers to the variant, which must not move with the judge.
  std::unique_ptr<FixedVariant> variant_;
  std::shared_ptr<TesselReporterObjectFilter> filter_;
};

}  // namespace tessel::ctl
