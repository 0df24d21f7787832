// The decision about an object, and the counters.
//
// This code runs for every object of a day. It copies and hashes no text, and it allocates only for
// a new (subsystem, category) pair. The order of the checks matters: the first check that fails
// names the reason. Downsampling comes last, because asking it advances its counters, and its ratio
// shall be one of the objects that passed everything else.

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

// A failed whitelist names its slot, a failed duration is negative, and failed downsampling names
// its entry. No other classification has a slot or a negative duration. A reported object may have
// an entry, too: the one that let it through.
bool isConsistent(const FilterDecision& decision) {
  const auto code = decision.classification;
  return (decision.stringSlot != 0) ==
             (code == TesselReporterClassificationFailedStringWhitelist) &&
         (decision.durationSeconds < 0.0F) ==
             (code == TesselReporterClassificationDurationThreshold) &&
         (decision.downsampleEntry != nullptr ||
          code != TesselReporterClassificationFailedSCFilter);
}

// `slot` is an index from 0. The decision counts from 1, because people see it and the accessors
// are called string1Value() and string2Value().
void failSlot(const TesselObject& object, size_t slot, FilterDecision& decision) {
  const LabelledString& string = object.labelledStrings()[slot];
  decision.stringSlot = static_cast<uint8_t>(slot + 1);
  decision.stringLabel = string.label;
  decision.stringValue = string.value;
}

// The rule checks the component before the action. If both are unknown, the decision therefore
// names the component.
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
  // For an unknown platform no list says what may leave the machine, so there is no filter for it.
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
  // Tools show these fields as the reason of the decision, so they must fit the classification.
  TESSEL_INVARIANT(isConsistent(decision));
  incrementTotalForObject(object, decision.classification);
  return decision;
}

FilterDecision TesselReporterObjectFilter::decide(const TesselSupportObject& supportObject) const {
  FilterDecision decision;
  // The class comes first: the checks after it read fields that only a TesselObject has.
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

// The special rule holds on internal builds, too, so it comes before the question for the build
// variant. An operation that passes the rule skips the whitelist: the rule has already checked both
// strings, and more strictly. The whitelist would also take a component's name for an action.
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
    // A value without a label is never sent, so it need not be a known one.
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
  // We do not call shouldReportObject() of the filter, because it does not tell which entry
  // decided.
  TRDownsampleEntry* entry = scnFilter_->downsampleEntryForObject(object);
  decision.downsampleEntry = entry;
  return entry == nullptr || entry->shouldReportThisTime();
}

void TesselReporterObjectFilter::incrementTotalForObject(
    const TesselSupportObject& object, TesselReporterClassification classification) {
  const TesselObject* point = asTesselObject(object);
  // A support object that is no TesselObject has no subsystem and no category. It still counts as
  // inspected: otherwise the classifications would not add up to the inspected objects.
  const StringRef subsystem = point ? point->subsystem() : StringRef();
  const StringRef category = point ? point->category() : StringRef();

  // Every object is counted here and under one classification, so the totals of the classifications
  // add up to the total of the inspected objects.
  allInspected_.incrementSubsystem(subsystem, category);
  if (classification < classified_.size())
    classified_[classification].incrementSubsystem(subsystem, category);

  const bool reported = classification == TesselReporterClassificationTelemetryReported;
  // The animation interval is asked for first, because it is an interval, too.
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
