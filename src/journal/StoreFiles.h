// StoreFiles: finds and opens the files of a journal store.
//
// Files are held open from the moment they are found and known by device and inode. The place is
// listed again until nothing new shows up, so that a file that is renamed meanwhile is neither lost
// nor met twice.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "journal/EntryStream.h"
#include "os/UniqueFd.h"
#include "platform/Error.h"

namespace tessel {

enum class StoreFileKind { journal, exportStream };

struct StoreFile {
  std::string path;  // as it was found; it may have another name by now
  StoreFileKind kind = StoreFileKind::journal;
  UniqueFd fd;    // not valid where it could not be opened
  int error = 0;  // errno of opening it, then
};

struct StoreFiles {
  std::vector<StoreFile> files;
  uint64_t leftOut = 0;  // files beyond the limit
};

// The files at `path`, a directory or one file, or of the machine's own journal where it is absent;
// at most `limit`. An error where there is no such place or it may not be read.
std::variant<StoreFiles, PlatformError> openStoreFiles(const std::optional<std::string>& path,
                                                       size_t limit, const StopFlag& stop);

// What `error`, an errno, says, with what to do about it where access was denied.
std::string whyNotOpened(int error);

}  // namespace tessel
