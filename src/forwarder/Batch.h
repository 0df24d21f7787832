// What goes into one request.

#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "statora/ForwarderState.h"

namespace tessel {

struct OutgoingRecord {
  SpooledEvent event;
  std::string json;  // the log record
};

struct Batch {
  std::vector<OutgoingRecord> records;
  std::vector<SpooledEvent> malformed;  // rows that are no events
  int64_t lastId = 0;                   // of all these
};

// The first of `events` whose records hold no more than `maxBytes` together; one at least. The rest
// is left for the next batch. REQUIRES: there are some.
Batch cutBatch(std::vector<SpooledEvent> events, std::string_view spoolId, size_t maxBytes);

}  // namespace tessel
