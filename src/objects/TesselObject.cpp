// What the classes of trace objects do themselves: membership, and the analytics payloads.
//
// A derived class takes the payload of its base and adds to it. Keys are sent in the
// order in which they are set, so receivers see it, and a new key goes to the end of its class's
// part.

#include "objects/TesselObject.h"

#include <array>
#include <string_view>

#include "objects/ProcessIdentity.h"
#include "platform/Log.h"

namespace tessel {

namespace {

// One record for the life of the process, so that a payload without a name allocates none.
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

// Two applications may use one process name, but not one bundle identifier, so that wins.
SharedString processNameOf(const EmittingProcess& process, ProcessIdentity& identity) {
  SharedString bundleIdentifier = identity.bundleIdentifierForImagePath(process.imagePath);
  if (bundleIdentifier.present()) return bundleIdentifier;
  return process.name.present() ? SharedString(process.name) : unknownText();
}

// These two trace on behalf of other applications and name the one in an attribute. The attribute
// of any other subsystem may mean anything and is ignored.
bool takesBundleIdOverride(const TesselInterval& interval) {
  if (sameString(interval.subsystem(), "com.vantor.morvald")) return true;
  return sameString(interval.subsystem(), "com.vantor.Harrowmere") &&
         sameString(interval.category(), "Snapshot");
}

}  // namespace

// Asked several times for every object, so the class is a value; a dynamic_cast would walk the
// tree.
bool TesselSupportObject::isKindOf(TesselClass wanted) const {
  if (class_ == wanted) return true;
  switch (wanted) {
    case TesselClass::supportObject:
      return true;
    case TesselClass::object:
      return class_ != TesselClass::supportObject;
    case TesselClass::interval:
      return class_ == TesselClass::animationInterval;
    case TesselClass::event:
    case TesselClass::animationInterval:
      return false;
  }
  return false;
}

StringRef TesselInterval::attribute(std::string_view key) const {
  // An interval has 64 attributes at most and usually none, so a search beats a map.
  for (const auto& [name, value] : interval_.attributes) {
    if (sameString(name, key)) return value;
  }
  return {};
}

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
