// The record of the last run on disk: `<state>/last_run.json`.
//
// Stateless; any thread.

#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "objects/RunRecord.h"
#include "platform/Error.h"

namespace tessel {

std::string runRecordPath(const std::string& stateDirectory);

// Our records have an eighth of this at most, so a larger one of a later service can still be
// read. The bound keeps a file that somebody else put there from filling the memory.
inline constexpr size_t kMaxRunRecordBytes = size_t{1} << 20;

// Replaces the record in the state directory. The file stays below 128 KiB whatever the store
// holds, because the list of losses is bounded and long texts lose their middle. The error is
// absent if that succeeded. REQUIRES: the run was tasked.
std::optional<PlatformError> writeRunRecord(const RunRecord& record,
                                            const std::string& stateDirectory);

// The last record. Absent if there is none, if it is no file of the directory's owner, or if it
// cannot be understood. `reading` is absent in a record of an older service that kept it in another
// form.
std::optional<RunRecord> readRunRecord(const std::string& stateDirectory);

}  // namespace tessel
