// Recording an entry: to the journal daemon, or to an export file where no daemon runs.
//
// Any number of processes may append to one export file. Each entry is written whole, under a lock
// of the file. What the daemon would have added to the entry comes from the caller.
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

// What the journal daemon adds to an entry. What is absent does not appear in the entry.
struct RecordOrigin {
  uint64_t realtime = 0;   // microseconds since 1970
  uint64_t monotonic = 0;  // microseconds since boot
  Id128 boot{};
  std::optional<std::string> imagePath;
  std::optional<std::string> processName;
  std::optional<std::string> process;
};

// The calling process, now.
RecordOrigin currentOrigin();

// The entry in the Journal Export Format, with its empty line.
std::string exportText(const EntryHeader& header, const RecordOrigin& origin,
                       const std::vector<RecordedField>& fields);

// Appends one entry to `<directory>/tessel.export` and makes both if they do not exist; or to
// `directory` itself if it names an `.export` file. After an error, which names the path and the
// reason, nothing was appended.
std::optional<PlatformError> appendToExportFile(const std::string& directory,
                                                const RecordOrigin& origin,
                                                const std::vector<RecordedField>& fields);

// Hands one entry to the journal daemon of this machine. No daemon is an error too, although the
// system's own library takes it for success.
std::optional<PlatformError> sendToJournal(const std::vector<RecordedField>& fields);

}  // namespace tessel
