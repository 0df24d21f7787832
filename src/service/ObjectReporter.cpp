// The way of one object: filter, payload, pacing, two sends.
//
// An object that the filter holds back costs no payload and no pacing. A payload is made once, and
// both events share it.

#include "service/ObjectReporter.h"

#include <string>

#include "platform/Invariant.h"
#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

namespace {

constexpr std::string_view kFixedEventName = "com.vantor.performance.tessel";

// The name of the second event has three parts. If one were left empty, different kinds of objects
// could share an event name, so an object without all three has no second event.
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
  // The type of the disk is a constant: every machine reports "SSD", whatever disk it has.
  BootVolumeFacts facts{{}, SharedString("SSD")};
  const std::optional<std::string> filesystem = volumes.rootFilesystemTypeName();
  // A payload must be valid UTF-8, but the mount table may contain any bytes.
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
  // We measure the rows here and not where they are stored: only this thread knows whose they are.
  // A run makes at most 40 objects a second into rows, so the text that is thrown away costs
  // nothing.
  const size_t bytes = payloadJson(*payload).size();
  queuedBytes_ += sender_.spaceOf(bytes + kFixedEventName.size());
  if (hasEventName(*object))
    queuedBytes_ += sender_.spaceOf(bytes + replaceInvalidUtf8(eventName(*object)).size());
  // The throttle sleeps on this thread, which is the one that delivers objects. The extractor
  // therefore slows down to the pace of the sends. If the queue slept instead, it would fill up.
  throttle_.throttleReportedEvent();
  reportingQueue_.async(
      [this, payload] { sender_.sendEvent(kFixedEventName, *payload, EventRank::object); });
  // An object without a second event takes this step, too. The pace of a run therefore only depends
  // on the number of reported objects.
  throttle_.throttleReportedEvent();
  reportingQueue_.async([this, object, payload] {
    if (hasEventName(*object)) sender_.sendEvent(eventName(*object), *payload, EventRank::object);
  });
}

bool ObjectReporter::reportTesselObject(const std::shared_ptr<const TesselObject>& object) {
  if (!filter_->shouldReportTesselObject(*object, nullptr)) return true;
  std::optional<Payload> payload = reportPayload(*object, identity_, bootVolume_);
  if (!payload) {
    tesselReporterLog().debug("Failed to create payload for %@/%@%@", object->subsystem(),
                              object->category(), object->name());
    ++unsendableCount_;
    return true;
  }
  if (!hasEventName(*object)) ++unnamedCount_;
  // The run's record expects two rows for each reported object, less one for each unnamed object
  // and two for each unsendable one. More of these than reported objects would make that number
  // meaningless.
  TESSEL_INVARIANT(unnamedCount_ + unsendableCount_ <=
                   filter_->telemetryReportedAggregation().totalCount());
  road_.send(object, std::make_shared<const Payload>(*std::move(payload)));
  return true;
}

}  // namespace tessel
