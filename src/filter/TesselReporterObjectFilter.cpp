// The decision about an object, and its counting.
//
// This runs for every object of a day, so nothing here allocates, copies or hashes a text. The
// checks stand in the order of their codes' definition: the cheapest first, and last the one that
// changes counters, which must only see objects that passed everything else.

#include "filter/TesselReporterObjectFilter.h"

#include <type_traits>
#include <utility>

#include "platform/Invariant.h"
#include "whitelist/StringWhitelist.h"

namespace tessel {

static_assert(std::is_trivially_copyable_v<FilterDecision>, "one is made for every object");

namespace {

const TesselObject* asTesselObject(const TesselSupportObject& object) {
  return object.isKindOf(TesselClass::object) ? static_cast<const TesselObject*>(&object) : nullptr;
}

// Whether exactly the fields of the classification's own rule are set.
bool isConsistent(const FilterDecision& decision) {
  const auto code = decision.classification;
  return (decision.stringSlot != 0) ==
             (code == TesselReporterClassificationFailedStringWhitelist) &&
         (decision.durationSeconds < 0.0F) ==
             (code == TesselReporterClassificationDurationThreshold) &&
         (decision.downsampleEntry != nullptr ||
          code != TesselReporterClassificationFailedSCFilter);
}

// Counts slots from 0; the decision names them from 1, as their accessors do.
void failSlot(const TesselObject& object, size_t slot, FilterDecision& decision) {
  const LabelledString& string = object.labelledStrings()[slot];
  decision.stringSlot = static_cast<uint8_t>(slot + 1);
  decision.stringLabel = string.label;
  decision.stringValue = string.value;
}

// A component that is not known is at fault even if the action is not known either: the rule reads
// the strings in that order.
void failSpecialRule(const TesselObject& object, FilterDecision& decision) {
  decision.specialRule = true;
  const bool componentIsKnown = perfLoggingComponentSet().contains(object.string1Value());
  failSlot(object, componentIsKnown ? 1 : 0, decision);
}

}  // namespace

std::shared_ptr<TesselReporterObjectFilter> TesselReporterObjectFilter::init(
    BuildVariant& variant) {
  return initWithPlatform(currentPlatform(), variant);
}

std::shared_ptr<TesselReporterObjectFilter> TesselReporterObjectFilter::initWithPlatform(
    TesselReporterPlatform platform, BuildVariant& variant) {
  // Nobody knows what may leave a platform that nobody knows.
  if (platform == TesselReporterPlatform::unknown) return nullptr;
  return std::shared_ptr<TesselReporterObjectFilter>(
      new TesselReporterObjectFilter(platform, variant));
}

TesselReporterObjectFilter::TesselReporterObjectFilter(TesselReporterPlatform platform,
                                                       BuildVariant& variant)
    : platform_(platform),
      profile_(profileOf(platform)),
      variant_(variant),
      scnFilter_(defaultFilterForPlatform(platform)) {}

bool TesselReporterObjectFilter::shouldReportTesselObject(
    const TesselSupportObject& object, TesselReporterClassification* classificationOut) {
  const FilterDecision decision = inspectTesselObject(object);
  if (classificationOut != nullptr) *classificationOut = decision.classification;
  return decision.shouldReport();
}

FilterDecision TesselReporterObjectFilter::inspectTesselObject(const TesselSupportObject& object) {
  const FilterDecision decision = decide(object);
  // Whoever is shown the reason is shown these fields, so they must name what decided.
  TESSEL_INVARIANT(isConsistent(decision));
  incrementTotalForObject(object, decision.classification);
  return decision;
}

FilterDecision TesselReporterObjectFilter::decide(const TesselSupportObject& supportObject) const {
  FilterDecision decision;
  const TesselObject* object = asTesselObject(supportObject);
  if (object == nullptr || !object->canGenerateStatoraPayload()) {
    decision.classification = TesselReporterClassificationClassNotSupported;
  } else if (!object->telemetryEnabled()) {
    decision.classification = TesselReporterClassificationTelemetryDisabled;
  } else if (object->durationSeconds() < 0.0F) {
    decision.classification = TesselReporterClassificationDurationThreshold;
    decision.durationSeconds = object->durationSeconds();
  } else if (!objectPassesStringFilter(*object, decision)) {
    decision.classification = TesselReporterClassificationFailedStringWhitelist;
  } else if (!objectPassesDownsampling(*object, decision)) {
    decision.classification = TesselReporterClassificationFailedSCFilter;
  }
  return decision;
}

// The special rule comes before the build variant is asked, so it holds on internal builds, too. An
// operation that passes it is not held against the whitelist, which mixes components and actions.
bool TesselReporterObjectFilter::objectPassesStringFilter(const TesselObject& object,
                                                          FilterDecision& decision) const {
  const bool special = profile_.hasPerfLoggingRule &&
                       isPerfLoggingOperation(object.subsystem(), object.category(), object.name());
  if (special && !perfLoggingOperationStringsPass(object.string1Value(), object.string2Value())) {
    failSpecialRule(object, decision);
    return false;
  }
  if (!shouldUseStringWhitelist(variant_) || special) return true;
  for (size_t slot = 0; slot < kLabelledStrings; ++slot) {
    // A value without a label never leaves the machine, so it need not be a known one.
    const LabelledString& string = object.labelledStrings()[slot];
    if (!string.label.present() || stringIsWhitelisted(string.value, platform_)) continue;
    failSlot(object, slot, decision);
    return false;
  }
  return true;
}

bool TesselReporterObjectFilter::objectPassesDownsampling(const TesselObject& object,
                                                          FilterDecision& decision) const {
  if (scnFilter_ == nullptr) return true;
  // Not shouldReportObject(), which does not tell which entry decided.
  TRDownsampleEntry* entry = scnFilter_->downsampleEntryForObject(object);
  decision.downsampleEntry = entry;
  return entry == nullptr || entry->shouldReportThisTime();
}

void TesselReporterObjectFilter::incrementTotalForObject(
    const TesselSupportObject& object, TesselReporterClassification classification) {
  const TesselObject* point = asTesselObject(object);
  // What is no trace point has neither name, and still counts as inspected.
  const StringRef subsystem = point ? point->subsystem() : StringRef();
  const StringRef category = point ? point->category() : StringRef();

  // Every object goes into the first and into one of the others, so those sum up to the first.
  allInspected_.incrementSubsystem(subsystem, category);
  if (classification < classified_.size())
    classified_[classification].incrementSubsystem(subsystem, category);

  const bool reported = classification == TesselReporterClassificationTelemetryReported;
  // The most derived class first, because an animation interval is an interval, too.
  if (object.isKindOf(TesselClass::animationInterval)) {
    animations_.count(reported);
  } else if (object.isKindOf(TesselClass::interval)) {
    intervals_.count(reported);
  } else if (object.isKindOf(TesselClass::event)) {
    events_.count(reported);
    if (reported) reportedEvents_.incrementSubsystem(subsystem, category);
  }
}

ClassifiedCounts TesselReporterObjectFilter::classifiedCounts() const {
  ClassifiedCounts counts{};
  for (size_t code = 0; code < counts.size(); ++code) counts[code] = classified_[code].totalCount();
  return counts;
}

}  // namespace tessel
