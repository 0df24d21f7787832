// ObjectReporter: what happens to one delivered trace object, from the filter to two queued sends.
//
// Made once per run and shared by the three callbacks. report() runs on the delivering thread, one
// object at a time, and sleeps there where the sends go too fast; the sends themselves run on the
// reporting queue and hold what they send.

#pragma once

#include <memory>

#include "filter/TesselReporterObjectFilter.h"
#include "objects/ProcessIdentity.h"
#include "objects/TesselObject.h"
#include "platform/Analytics.h"
#include "platform/SerialQueue.h"
#include "platform/Throttle.h"

namespace tessel {

// How payloads are made and leave; lives as long as the process.
struct EventRoad {
  ProcessIdentity& identity;
  Throttle& throttle;
  EventSender& sender;
  SerialQueue& reportingQueue;
};

class ObjectReporter {
 public:
  // `bootFilesystem` may be absent.
  ObjectReporter(const EventRoad& road, std::shared_ptr<TesselReporterObjectFilter> filter,
                 SharedString bootFilesystem, SharedString bootDisk)
      : road_(road),
        filter_(std::move(filter)),
        bootFilesystem_(std::move(bootFilesystem)),
        bootDisk_(std::move(bootDisk)) {}

  // Always true.
  bool reportTesselObject(const std::shared_ptr<const TesselObject>& object);

 private:
  void send(const std::shared_ptr<const TesselObject>& object,
            std::shared_ptr<const Payload> payload);

  const EventRoad road_;
  const std::shared_ptr<TesselReporterObjectFilter> filter_;
  const SharedString bootFilesystem_;
  const SharedString bootDisk_;
};

}  // namespace tessel
