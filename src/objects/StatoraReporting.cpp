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

// An absent label keeps its value out, too; an absent value keeps out only itself.
void setLabelled(Payload& payload, std::string_view labelKey, StringRef label,
                 std::string_view valueKey, StringRef value) {
  if (!label.present()) return;
  payload.set(labelKey, label);
  payload.set(valueKey, value);
}

void setLabelled(Payload& payload, std::string_view labelKey, StringRef label,
                 std::string_view valueKey, const std::optional<Number>& value) {
  if (!label.present()) return;
  payload.set(labelKey, label);
  if (value) payload.set(valueKey, *value);
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
  setLabelled(payload, "String1Name", string1Name(), "String1Value", string1Value());
  setLabelled(payload, "String2Name", string2Name(), "String2Value", string2Value());
  setLabelled(payload, "Number1Name", number1Name(), "Number1Value", number1Value());
  setLabelled(payload, "Number2Name", number2Name(), "Number2Value", number2Value());
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
