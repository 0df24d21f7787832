// ObjectReporter: takes one delivered trace object through the filter, makes its payload and queues
// its two events.

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <utility>

#include "filter/TesselReporterObjectFilter.h"
#include "objects/ProcessIdentity.h"
#include "objects/TesselObject.h"
#include "platform/Analytics.h"
#include "platform/Queues.h"
#include "platform/System.h"

namespace tessel {

// What every payload says about the boot volume. The filesystem may be absent.
struct BootVolumeFacts {
  SharedString filesystem;
  SharedString disk;
};

// The facts of this machine. The filesystem is absent if it is unknown or its name is not valid
// UTF-8. Both facts are logged.
BootVolumeFacts bootVolumeFacts(Volumes& volumes);

// The payload of a reportable object, with the boot volume added. Absent if the object has none.
std::optional<Payload> reportPayload(const TesselObject& object, ProcessIdentity& identity,
                                     const BootVolumeFacts& bootVolume);

// Sends the events of an object. Pacing happens on the calling thread, sending on the reporting
// queue. The queued jobs refer to the road, so it must live as long as the process.
class EventRoad {
 public:
  EventRoad(Throttle& throttle, EventSender& sender, SerialQueue& reportingQueue)
      : throttle_(throttle), sender_(sender), reportingQueue_(reportingQueue) {}

  // Bytes that all rows queued so far take of what a run may send.
  uint64_t queuedBytes() const { return queuedBytes_; }

  // Queues two events with the same payload. The first has the name that all objects share. The
  // second is named after the object; an object without subsystem, category or name has no second.
  // Sleeps if the sends come too fast. The queued jobs keep the object and the payload alive.
  void send(const std::shared_ptr<const TesselObject>& object,
            const std::shared_ptr<const Payload>& payload);

 private:
  Throttle& throttle_;
  EventSender& sender_;
  SerialQueue& reportingQueue_;
  uint64_t queuedBytes_ = 0;
};

// Reports the objects of one run. The three callbacks of the extractor share it.
//
// Threads: reportTesselObject() runs on the delivering thread, one object at a time. The thread of
// the run may use the other functions once all objects have been delivered.
class ObjectReporter {
 public:
  ObjectReporter(std::shared_ptr<TesselReporterObjectFilter> filter, BootVolumeFacts bootVolume,
                 ProcessIdentity& identity, EventRoad& road)
      : filter_(std::move(filter)),
        bootVolume_(std::move(bootVolume)),
        identity_(identity),
        road_(road) {}

  // Always returns true: the extractor shall go on.
  bool reportTesselObject(const std::shared_ptr<const TesselObject>& object);

  const TesselReporterObjectFilter& filter() const { return *filter_; }
  // Reported objects that lack subsystem, category or name. They send one event instead of two.
  uint64_t unnamedCount() const { return unnamedCount_; }
  // Reported objects of which no payload could be made. They send no event.
  uint64_t unsendableCount() const { return unsendableCount_; }

 private:
  const std::shared_ptr<TesselReporterObjectFilter> filter_;
  const BootVolumeFacts bootVolume_;
  ProcessIdentity& identity_;
  EventRoad& road_;
  uint64_t unnamedCount_ = 0;
  uint64_t unsendableCount_ = 0;
};

}  // namespace tessel
