// TesselSupportObjectExtractor: the trace-extraction service as the service uses it.
//
// One extractor serves one run. The run sets the callbacks and the option and makes one processing
// call. After the call has returned, the run asks for the results.
//
// Delivery: each call of a callback delivers one object. The calls come one at a time, and the last
// one ends before the processing call returns. A callback may sleep. An animation interval goes to
// the animation callback and to no other. A delivered object stays valid and unchanged while
// somebody holds it.
//
// Threads: stopProcessing() may be called from any thread, before, during and after processing,
// and never waits for a callback. Everything else belongs to the thread of the run.

#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "objects/TesselObject.h"
#include "platform/Error.h"
#include "platform/Losses.h"
#include "platform/System.h"

namespace tessel {

using IntervalCallback = std::function<bool(const std::shared_ptr<const TesselInterval>&)>;
using AnimationIntervalCallback =
    std::function<bool(const std::shared_ptr<const TesselAnimationInterval>&)>;
using EventCallback = std::function<bool(const std::shared_ptr<const TesselEvent>&)>;

class TesselSupportObjectExtractor {
 public:
  virtual ~TesselSupportObjectExtractor() = default;

  virtual void setIntervalCompletionProcessingBlock(IntervalCallback callback) = 0;
  virtual void setAnimationIntervalCompletionProcessingBlock(
      AnimationIntervalCallback callback) = 0;
  virtual void setEmitEventProcessingBlock(EventCallback callback) = 0;
  virtual void setBuildAnimationCompositeIntervalTimelines(bool build) = 0;

  // Delivers the trace points recorded in [startDate, endDate) from the store at `path`. An absent
  // path means the store that this extractor was made for. Blocks until all are delivered or a stop
  // has taken effect. False if processing failed; `errorOut` then says why.
  virtual bool processLogArchiveWithPath(const std::optional<std::string>& path, Date startDate,
                                         Date endDate, std::optional<PlatformError>& errorOut) = 0;
  // Ends the processing call early. A stop before the call began makes it return at once.
  virtual void stopProcessing() = 0;
  // Log events that the last processing call read, trace points or not.
  virtual uint64_t processedEventCount() const = 0;
  // What the last processing call read of the store, and what was lost; absent if there was no
  // store to read.
  virtual std::optional<StoreReading> reading() const = 0;
};

using ExtractorFactory = std::function<std::shared_ptr<TesselSupportObjectExtractor>()>;

}  // namespace tessel
