// Recording an entry: to the journal daemon, or to an export file where no daemon runs.
//
// Any number of processes may append to one export file: each writes a whole entry while it holds a
// lock on the file. There is no daemon to add time, boot and process, so the caller supplies them.
//
// Threads: any, at the same time.

#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "journal/EntryStream.h"
#include "platform/Error.h"

namespace tessel {

struct RecordedField {
  std::string name;
  std::string value;
};

// The fields that the journal daemon would add to an entry. An absent one is left out.
struct RecordOrigin {
  uint64_t realtime = 0;   // microseconds since 1970
  uint64_t monotonic = 0;  // microseconds since boot
  Id128 boot{};
  std::optional<std::string> imagePath;
  std::optional<std::string> processName;
  std::optional<std::string> process;  // its id, in decimal
  std::optional<std::string> user;     // its real user id, in decimal
};

// The calling process, now.
RecordOrigin currentOrigin();

// The entry in the Journal Export Format, with the empty line that ends it.
std::string exportText(const EntryHeader& header, const RecordOrigin& origin,
                       const std::vector<RecordedField>& fields);

// Appends one entry to `<directory>/tessel.export` and makes the file if it does not exist. A
// missing directory is an error: a misspelt path would swallow the entries. If `directory` ends in
// `.export`, it is the file itself. An error names the path and the reason.
// After an error nothing was appended, except when it says that half an entry could not be taken
// back: the next append then ends that half, and readers report it as damage.
std::optional<PlatformError> appendToExportFile(const std::string& directory,
                                                const RecordOrigin& origin,
                                                const std::vector<RecordedField>& fields);

// False where the environment says TESSEL_TRACE=0.
bool recordingEnabled();

// Hands one entry to the journal daemon of this machine, as a program with the recording header
// does: the same socket for all entries, the same wait, the same count of what was lost. It is an
// error if there is no daemon; the system's own library would return success.
std::optional<PlatformError> sendToJournal(const std::vector<RecordedField>& fields);

// Counts a trace point as lost that was never handed over: the end of an interval whose begin was.
void countAsLost();

}  // namespace tessel
