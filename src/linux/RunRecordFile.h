// The record of the last run on disk: `<state>/last_run.json`.
//
// Stateless; any thread.

#pragma once

#include <optional>
#include <string>

#include "objects/RunRecord.h"
#include "platform/Error.h"

namespace tessel {

// Replaces the record in the state directory. The file stays below 64 KiB whatever the store looked
// like, because the list of losses is bounded and long texts lose their middle. Absent if that
// succeeded. REQUIRES: the run was tasked.
std::optional<PlatformError> writeRunRecord(const RunRecord& record,
                                            const std::string& stateDirectory);

// Nothing where there is no record or it cannot be understood. A record that an older service left
// has no reading.
std::optional<RunRecord> readRunRecord(const std::string& stateDirectory);

}  // namespace tessel
