// Count events: one small analytics event for each of the first five keys of a summary section.

#pragma once

#include <cstdint>
#include <string_view>

#include "filter/TesselReporterAggregation.h"
#include "platform/Analytics.h"

namespace tessel {

// The count operation of one summary job. Used on the reporting queue alone.
class CountReporter {
 public:
  CountReporter(EventSender& sender, Throttle& throttle) : sender_(sender), throttle_(throttle) {}

  // Starts a section: its first five keys are sent, the others only logged.
  void beginSection() { sectionKeyCount_ = 0; }
  // Handles the next key of the section. REQUIRES: `aggregation` holds `key`.
  void reportCountForKey(const TesselReporterAggregationKey& key,
                         const TesselReporterAggregation& aggregation,
                         std::string_view classification);
  // Events sent so far, over all sections.
  uint64_t sentCount() const { return sentCount_; }

 private:
  EventSender& sender_;
  Throttle& throttle_;
  uint64_t sentCount_ = 0;
  uint64_t sectionKeyCount_ = 0;
};

}  // namespace tessel
