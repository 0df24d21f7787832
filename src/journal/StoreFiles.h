// StoreFiles: finds and opens the files of a journal store.
//
// The daemon renames and removes files while we list them. So each file is opened when it is found
// and known by device and inode, not by name, and the place is listed again until nothing new shows
// up. A file that is renamed meanwhile is then neither lost nor taken twice. Locking the directory
// would be simpler, but the daemon takes no such lock.
//
// Threads: one at a time, except for the stop flag.

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
  std::string path;  // when it was found; the file may have another name by now
  StoreFileKind kind = StoreFileKind::journal;
  UniqueFd fd;    // not valid if the file could not be opened
  int error = 0;  // errno, if the file could not be opened
};

struct StoreFiles {
  std::vector<StoreFile> files;
  uint64_t leftOut = 0;  // files beyond the limit
};

// Opens the files at `path`, a directory or one file; without a path, those of this machine's
// journal; at most `limit`. An error if there is no such place or it cannot be read.
std::variant<StoreFiles, PlatformError> openStoreFiles(const std::optional<std::string>& path,
                                                       size_t limit, const StopFlag& stop);

// The words for the errno `error`; if access was denied, with what to do about it.
std::string whyNotOpened(int error);

}  // namespace tessel
