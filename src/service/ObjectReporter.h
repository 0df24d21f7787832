// ObjectReporter: what happens to one delivered trace object, from the filter to two queued sends.
//
// Made once per run and shared by the three callbacks. report() runs on the delivering thread, one
// object at a time, and sleeps there where the sends go too fast; the sends themselves run on the
// reporting queue and hold what they send.

#pragma once

#include <cstdint>
#include <memory>
#include <optional>

#include "filter/TesselReporterObjectFilter.h"
#include "objects/ProcessIdentity.h"
#include "objects/TesselObject.h"
#include "platform/Analytics.h"
#include "platform/Queues.h"

namespace tessel {

// How payloads are made and leave; lives as long as the process.
struct EventRoad {
  ProcessIdentity& identity;
  Throttle& throttle;
  EventSender& sender;
  SerialQueue& reportingQueue;
};

// What is known of the boot volume; the filesystem may be absent.
struct BootVolumeFacts {
  SharedString filesystem;
  SharedString disk;
};

// The payload that is sent for a reportable object; nothing where one cannot be made.
std::optional<Payload> reportPayload(const TesselObject& object, ProcessIdentity& identity,
                                     const BootVolumeFacts& bootVolume);

class ObjectReporter {
 public:
  // `bootFilesystem` may be absent.
  ObjectReporter(const EventRoad& road, std::shared_ptr<TesselReporterObjectFilter> filter,
                 SharedString bootFilesystem, SharedString bootDisk)
      : road_(road),
        filter_(std::move(filter)),
        bootVolume_{std::move(bootFilesystem), std::move(bootDisk)} {}

  // Always true.
  bool reportTesselObject(const std::shared_ptr<const TesselObject>& object);
  // Reported objects without a name, for which one event is sent instead of two.
  uint64_t unnamedCount() const { return unnamedCount_; }

 private:
  void send(const std::shared_ptr<const TesselObject>& object,
            const std::shared_ptr<const Payload>& payload);

  const EventRoad road_;
  const std::shared_ptr<TesselReporterObjectFilter> filter_;
  const BootVolumeFacts bootVolume_;
  uint64_t unnamedCount_ = 0;
};

}  // namespace tessel
