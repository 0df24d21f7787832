// The classes of trace objects: which class an object belongs to, and its analytics payload.
//
// A derived class takes the payload of its base class and adds its own keys at the end. Keys are
// sent in the order in which they are set, so receivers see any change of that order.

#include "objects/TesselObject.h"

#include <array>
#include <string_view>

#include "objects/ProcessIdentity.h"
#include "platform/Log.h"

namespace tessel {

namespace {

// All payloads without a name share this one string, so they need not allocate it.
const SharedString& unknownText() {
  static const SharedString& text = *new SharedString("Unknown");
  return text;
}

struct SlotKeys {
  std::string_view label;
  std::string_view value;
};

// Indexed by slot. A payload keeps views of its keys, so each key must be a literal and cannot be
// put together from a slot number.
constexpr std::array<SlotKeys, kLabelledStrings> kStringKeys = {
    {{"String1Name", "String1Value"}, {"String2Name", "String2Value"}}};
constexpr std::array<SlotKeys, kLabelledNumbers> kNumberKeys = {
    {{"Number1Name", "Number1Value"}, {"Number2Name", "Number2Value"}}};

// Without its label a value means nothing to a receiver, so an argument without a label is left out
// whole. If only the value is absent, the label is sent alone.
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

// The bundle identifier goes first, because two applications may have the same process name.
SharedString processNameOf(const EmittingProcess& process, ProcessIdentity& identity) {
  SharedString bundleIdentifier = identity.bundleIdentifierForImagePath(process.imagePath);
  if (bundleIdentifier.present()) return bundleIdentifier;
  return process.name.present() ? SharedString(process.name) : unknownText();
}

// These two writers trace on behalf of other applications, and an attribute names the application.
// In a trace point of another subsystem the attribute may mean anything, so it is ignored there.
bool takesBundleIdOverride(const TesselInterval& interval) {
  if (sameString(interval.subsystem(), "com.vantor.morvald")) return true;
  return sameString(interval.subsystem(), "com.vantor.Harrowmere") &&
         sameString(interval.category(), "Snapshot");
}

}  // namespace

StringRef TesselInterval::attribute(std::string_view key) const {
  // The begin and the end of an interval bring at most 32 attributes each. A list that short is
  // searched faster than a map is built.
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
