// ObjectReporter: what happens to one delivered trace object, from the filter to two queued sends.

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

// What every payload says of the boot volume. The filesystem may be absent.
struct BootVolumeFacts {
  SharedString filesystem;
  SharedString disk;
};

// The facts of this machine. Logs the filesystem type, or that it could not be determined or is not
// valid UTF-8, in which case it is absent.
BootVolumeFacts bootVolumeFacts(Volumes& volumes);

// The payload that is sent for a reportable object; absent if none can be made.
std::optional<Payload> reportPayload(const TesselObject& object, ProcessIdentity& identity,
                                     const BootVolumeFacts& bootVolume);

// The way of an object's events: paced on the calling thread, sent on the reporting queue. Lives as
// long as the process.
class EventRoad {
 public:
  EventRoad(Throttle& throttle, EventSender& sender, SerialQueue& reportingQueue)
      : throttle_(throttle), sender_(sender), reportingQueue_(reportingQueue) {}

  // Sends the payload twice: as the event of all objects, and as one named after the object if that
  // has all three names. Sleeps where the sends go too fast. The queued sends hold what they send.
  void send(const std::shared_ptr<const TesselObject>& object,
            const std::shared_ptr<const Payload>& payload);

 private:
  Throttle& throttle_;
  EventSender& sender_;
  SerialQueue& reportingQueue_;
};

// One run's reporting. The three callbacks of the extractor share it.
//
// Threads: reportTesselObject() runs on the delivering thread, one object at a time. Everything
// else belongs to the thread of the run, once all objects have been delivered.
class ObjectReporter {
 public:
  ObjectReporter(std::shared_ptr<TesselReporterObjectFilter> filter, BootVolumeFacts bootVolume,
                 ProcessIdentity& identity, EventRoad& road)
      : filter_(std::move(filter)),
        bootVolume_(std::move(bootVolume)),
        identity_(identity),
        road_(road) {}

  // Always true, which tells the extractor to go on.
  bool reportTesselObject(const std::shared_ptr<const TesselObject>& object);

  const TesselReporterObjectFilter& filter() const { return *filter_; }
  // Reported objects without a name, for which one event is sent instead of two.
  uint64_t unnamedCount() const { return unnamedCount_; }

 private:
  const std::shared_ptr<TesselReporterObjectFilter> filter_;
  const BootVolumeFacts bootVolume_;
  ProcessIdentity& identity_;
  EventRoad& road_;
  uint64_t unnamedCount_ = 0;
};

}  // namespace tessel
