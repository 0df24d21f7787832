// Filter, payload, pacing and the two sends of one object.

#include "service/ObjectReporter.h"

#include <string>

#include "platform/Invariant.h"
#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// Two objects with different names must not share an event, so an object that lacks a part of the
// name has no such event.
bool hasEventName(const TesselObject& object) {
  return object.subsystem() && object.category() && object.name();
}

std::string eventName(const TesselObject& object) {
  std::string name = "ts__";
  name.append(object.subsystem().text()).append("__");
  name.append(object.category().text()).append("__");
  name.append(object.name().text());
  return name;
}

}  // namespace

BootVolumeFacts bootVolumeFacts(Volumes& volumes) {
  // The disk is not asked for: receivers only know this one type.
  BootVolumeFacts facts{{}, SharedString("SSD")};
  const std::optional<std::string> filesystem = volumes.rootFilesystemTypeName();
  // The mount table is raw bytes, and a payload must be text.
  if (filesystem && isValidUtf8(*filesystem)) {
    tesselReporterLog().debug("Filesystem for '/': %@", *filesystem);
    facts.filesystem = SharedString(*filesystem);
  } else {
    tesselReporterLog().debug("Could not determine filesystem type");
  }
  tesselReporterLog().debug("Boot disk type: %@", facts.disk);
  return facts;
}

std::optional<Payload> reportPayload(const TesselObject& object, ProcessIdentity& identity,
                                     const BootVolumeFacts& bootVolume) {
  std::optional<Payload> payload = object.statoraPayload(identity);
  if (payload) {
    payload->set("BootPartitionFS", bootVolume.filesystem);
    payload->set("BootDiskType", bootVolume.disk);
  }
  return payload;
}

void EventRoad::send(const std::shared_ptr<const TesselObject>& object,
                     const std::shared_ptr<const Payload>& payload) {
  // The delivering thread sleeps, not the queue, so the extractor slows down to the pace of the
  // sends instead of filling the queue.
  throttle_.throttleReportedEvent();
  reportingQueue_.async(
      [this, payload] { sender_.sendEvent("com.vantor.performance.tessel", *payload); });
  // An object without an event of its own is paced like any other.
  throttle_.throttleReportedEvent();
  reportingQueue_.async([this, object, payload] {
    if (hasEventName(*object)) sender_.sendEvent(eventName(*object), *payload);
  });
}

bool ObjectReporter::reportTesselObject(const std::shared_ptr<const TesselObject>& object) {
  if (!filter_->shouldReportTesselObject(*object, nullptr)) return true;
  std::optional<Payload> payload = reportPayload(*object, identity_, bootVolume_);
  if (!payload) {
    tesselReporterLog().debug("Failed to create payload for %@/%@%@", object->subsystem(),
                              object->category(), object->name());
    return true;
  }
  if (!hasEventName(*object)) ++unnamedCount_;
  // The record of the run expects two rows for each reported object and takes the unnamed ones off.
  TESSEL_INVARIANT(unnamedCount_ <= filter_->telemetryReportedAggregation().totalCount());
  road_.send(object, std::make_shared<const Payload>(*std::move(payload)));
  return true;
}

}  // namespace tessel
