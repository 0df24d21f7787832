// Cutting a batch.

#include "forwarder/Batch.h"

#include <utility>

#include "forwarder/OtlpBody.h"

namespace tessel {

Batch cutBatch(std::vector<SpooledEvent> events, std::string_view spoolId, size_t maxBytes) {
  Batch batch;
  batch.records.reserve(events.size());
  size_t bytes = 0;
  for (SpooledEvent& event : events) {
    auto json = otlpRecord(event, spoolId);
    if (json) {
      bytes += json->size() + 1;
      if (bytes > maxBytes && !batch.records.empty()) break;
    }
    batch.lastId = event.id;
    if (json) {
      batch.records.push_back({std::move(event), std::move(*json)});
    } else {
      batch.malformed.push_back(std::move(event));
    }
  }
  return batch;
}

}  // namespace tessel
