// Filter, payload, pacing and the two sends of one object.

#include "service/ObjectReporter.h"

#include "platform/Log.h"

namespace tessel {

namespace {

// The event named after the object. An object without a name has none.
void sendNamedPayloadEvent(EventSender& sender, const TesselObject& object,
                           const Payload& payload) {
  if (!object.subsystem() || !object.category() || !object.name()) return;
  std::string name = "ts__";
  name.append(object.subsystem().text()).append("__");
  name.append(object.category().text()).append("__");
  name.append(object.name().text());
  sender.sendEvent(name, payload);
}

}  // namespace

std::optional<Payload> reportPayload(const TesselObject& object, ProcessIdentity& identity,
                                     const BootVolumeFacts& bootVolume) {
  std::optional<Payload> payload = object.statoraPayload(identity);
  if (payload) {
    payload->set("BootPartitionFS", bootVolume.filesystem);
    payload->set("BootDiskType", bootVolume.disk);
  }
  return payload;
}

bool ObjectReporter::reportTesselObject(const std::shared_ptr<const TesselObject>& object) {
  if (!filter_->shouldReportTesselObject(*object, nullptr)) return true;
  std::optional<Payload> payload = reportPayload(*object, road_.identity, bootVolume_);
  if (!payload) {
    tesselReporterLog().debug("Failed to create payload for %@/%@%@", object->subsystem(),
                              object->category(), object->name());
    return true;
  }
  if (!object->name()) ++unnamedCount_;
  send(object, std::make_shared<const Payload>(*std::move(payload)));
  return true;
}

void ObjectReporter::send(const std::shared_ptr<const TesselObject>& object,
                          const std::shared_ptr<const Payload>& payload) {
  EventSender& sender = road_.sender;
  road_.throttle.throttleReportedEvent();
  road_.reportingQueue.async(
      [&sender, payload] { sender.sendEvent("com.vantor.performance.tessel", *payload); });
  road_.throttle.throttleReportedEvent();
  road_.reportingQueue.async(
      [&sender, object, payload] { sendNamedPayloadEvent(sender, *object, *payload); });
}

}  // namespace tessel
