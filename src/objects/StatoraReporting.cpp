// The analytics payloads of the trace objects. Keys are set in the order in which they are sent.

#include <string_view>

#include "objects/ProcessIdentity.h"
#include "objects/TesselObject.h"
#include "platform/Log.h"

namespace tessel {

namespace {

const SharedString& unknownText() {
  static const SharedString& text = *new SharedString("Unknown");
  return text;
}

struct SlotKeys {
  std::string_view label;
  std::string_view value;
};

// By slot. Spelled out, because a payload keeps views of its keys: they must be literals.
constexpr std::array<SlotKeys, kLabelledStrings> kStringKeys = {
    {{"String1Name", "String1Value"}, {"String2Name", "String2Value"}}};
constexpr std::array<SlotKeys, kLabelledNumbers> kNumberKeys = {
    {{"Number1Name", "Number1Value"}, {"Number2Name", "Number2Value"}}};

// A value without its label says nothing to a reader of the event, so it stays out with the label.
void setLabelledArguments(Payload& payload, const TesselObject& object) {
  for (size_t slot = 0; slot < kLabelledStrings; ++slot) {
    const LabelledString& string = object.labelledStrings()[slot];
    if (!string.label.present()) continue;
    payload.set(kStringKeys[slot].label, string.label);
    payload.set(kStringKeys[slot].value, string.value);
  }
  for (size_t slot = 0; slot < kLabelledNumbers; ++slot) {
    const LabelledNumber& number = object.labelledNumbers()[slot];
    if (!number.label.present()) continue;
    payload.set(kNumberKeys[slot].label, number.label);
    if (number.value) payload.set(kNumberKeys[slot].value, *number.value);
  }
}

// A bundle identifier says more than the process name that the event carries, so it wins.
SharedString processNameOf(const EmittingProcess& process, ProcessIdentity& identity) {
  SharedString bundleIdentifier = identity.bundleIdentifierForImagePath(process.imagePath);
  if (bundleIdentifier.present()) return bundleIdentifier;
  return process.name.present() ? SharedString(process.name) : unknownText();
}

// Whether an interval stands for a process other than those that traced it, where it names one.
bool takesBundleIdOverride(const TesselInterval& interval) {
  if (sameString(interval.subsystem(), "com.vantor.morvald")) return true;
  return sameString(interval.subsystem(), "com.vantor.Harrowmere") &&
         sameString(interval.category(), "Snapshot");
}

}  // namespace

std::optional<Payload> TesselSupportObject::statoraPayload(ProcessIdentity&) const {
  return std::nullopt;
}

std::optional<Payload> TesselObject::statoraPayload(ProcessIdentity&) const {
  Payload payload;
  payload.set("Subsystem", subsystem());
  payload.set("Category", category());
  payload.set("Name", name().present() ? SharedString(name()) : unknownText());
  setLabelledArguments(payload, *this);
  payload.set("IntervalType", SharedString(tesselType()));
  payload.set("DurationInSeconds", Number(durationSeconds()));
  return payload;
}

std::optional<Payload> TesselEvent::statoraPayload(ProcessIdentity& identity) const {
  auto payload = TesselObject::statoraPayload(identity);
  if (!payload) return payload;
  payload->set("StartProcessName", processNameOf(process_, identity));
  return payload;
}

std::optional<Payload> TesselInterval::statoraPayload(ProcessIdentity& identity) const {
  auto payload = TesselObject::statoraPayload(identity);
  if (!payload) return payload;
  const StringRef override = attribute("BundleIdOverride");
  if (override.present() && takesBundleIdOverride(*this)) {
    payload->set("StartProcessName", override);
    payload->set("EndProcessName", override);
    tesselReporterLog().debug("%@/%@/%@: Overriding bundle ID to %@", subsystem(), category(),
                              name(), override);
    return payload;
  }
  payload->set("StartProcessName", processNameOf(beginEvent(), identity));
  payload->set("EndProcessName", processNameOf(endEvent(), identity));
  return payload;
}

std::optional<Payload> TesselAnimationInterval::statoraPayload(ProcessIdentity& identity) const {
  auto payload = TesselInterval::statoraPayload(identity);
  if (!payload) return payload;
  payload->set("FrameRate", Number(frameRate()));
  return payload;
}

}  // namespace tessel
