// The record of the last run on disk: `<state>/last_run.json`.
//
// Stateless; any thread.

#pragma once

#include <optional>
#include <string>

#include "objects/RunRecord.h"
#include "platform/Error.h"

namespace tessel {

// Replaces the record in the state directory. The file stays below 64 KiB whatever the store holds,
// because the list of losses is bounded and long texts lose their middle. The error is absent if
// that succeeded. REQUIRES: the run was tasked.
std::optional<PlatformError> writeRunRecord(const RunRecord& record,
                                            const std::string& stateDirectory);

// The last record. Absent if there is none or it cannot be understood. `reading` is absent in a
// record of an older service that kept it in another form.
std::optional<RunRecord> readRunRecord(const std::string& stateDirectory);

}  // namespace tessel
