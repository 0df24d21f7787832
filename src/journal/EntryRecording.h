// Appending entries to a file in the Journal Export Format, where no journal daemon runs.
//
// Any number of processes may append to one file: each entry is written whole, under a lock of the
// file. What the daemon would have added comes from the caller.
//
// Sending an entry to the journal daemon of this machine.

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

// What the journal daemon adds to an entry; what is absent is left out of it.
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

// The entry with its address and origin in the format, the empty line at its end included.
std::string exportText(const EntryHeader& header, const RecordOrigin& origin,
                       const std::vector<RecordedField>& fields);

// Appends one entry to `<directory>/tessel.export`, making both where they are not there, or to
// `directory` itself where it names an `.export` file. An error names the path and the reason, and
// nothing was appended.
std::optional<PlatformError> appendToExportFile(const std::string& directory,
                                                const RecordOrigin& origin,
                                                const std::vector<RecordedField>& fields);

// Hands one entry to the daemon. An error says why it could not be handed over, a daemon that is
// not there included, which the system's own library does not tell.
std::optional<PlatformError> sendToJournal(const std::vector<RecordedField>& fields);

}  // namespace tessel
