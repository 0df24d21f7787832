// The past runs on disk: `<state>/last_run.json` holds the record of the last run, and the notes of
// the last 256.
//
// Stateless; any thread.

#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <variant>

#include "objects/RunRecord.h"
#include "platform/Error.h"

namespace tessel {

std::string runRecordPath(const std::string& stateDirectory);

// Our records have a quarter of this at most, so a larger one of a later service can still be
// read. The bound keeps a file that somebody else put there from filling the memory.
inline constexpr size_t kMaxRunRecordBytes = size_t{1} << 20;

// Both replace the file as a whole. It stays below 256 KiB whatever the store holds, because the
// list of losses is bounded and long texts lose their middle. The error is absent if that
// succeeded. REQUIRES: the caller holds the lock of the state directory.
//
// Adds the note of a run that is about to begin. `taskingFile` decided that it may.
std::optional<PlatformError> writeRunBegin(Date start, const std::string& taskingFile,
                                           const std::string& stateDirectory);
// Replaces the record, and completes the note of its run. REQUIRES: the run was tasked.
std::optional<PlatformError> writeRunRecord(const RunRecord& record,
                                            const std::string& stateDirectory);

// Of the past runs. Empty if there is no file. The error says why the file is not used: it is no
// file of the directory's owner, or it cannot be understood, or may not be read. `reading` is
// absent in a record of an older service that kept it in another form.
std::variant<RunHistory, PlatformError> readRunHistory(const std::string& stateDirectory);
// The last record of it. Absent if there is none, or if the file is not used.
std::optional<RunRecord> readRunRecord(const std::string& stateDirectory);

}  // namespace tessel
