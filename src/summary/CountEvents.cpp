// Sending or only logging one key's count.

#include "summary/CountEvents.h"

#include "platform/Log.h"

namespace tessel {

namespace {

constexpr uint64_t kLastSentPosition = 4;

Payload countPayload(const TesselReporterAggregationKey& key, uint64_t count,
                     std::string_view classification) {
  Payload payload;
  payload.set("Subsystem", key.subsystem());
  payload.set("Category", key.category());
  payload.set("Count", Number{count});
  payload.set("Classification", SharedString(classification));
  return payload;
}

}  // namespace

void CountReporter::reportCountForKey(const TesselReporterAggregationKey& key,
                                      const TesselReporterAggregation& aggregation,
                                      std::string_view classification) {
  throttle_.throttleReportedEvent();
  const uint64_t count = aggregation.countForKey(key);
  if (sectionKeyCount_ > kLastSentPosition) {
    tesselReporterLog().debug("%@:\t%llu (Count not reported)", key, count);
  } else {
    sender_.sendEvent("com.vantor.performance.tessel_counts",
                      countPayload(key, count, classification));
    ++sentCount_;
    tesselReporterLog().debug("%@:\t%llu (Count reported to Statora)", key, count);
  }
  ++sectionKeyCount_;
}

}  // namespace tessel
