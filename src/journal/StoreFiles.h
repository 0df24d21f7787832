// StoreFiles: finds and opens the files of a journal store.
//
// The daemon renames and removes files while we list them. So we open each file as soon as we find
// it, and recognise it by device and inode, not by name. We list the place again until nothing new
// shows up. A file that is renamed in between is then neither lost nor taken twice. It would be
// simpler to lock the directory, but the daemon heeds no such lock.
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
#include "platform/System.h"

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

// Opens the files at `path`, which is a directory or one file; without a path, the files of this
// machine's journal. Opens at most `limit` files. Returns an error if there is no such place or it
// cannot be read. Each file that it opens is a step for `progress`, which may be null.
std::variant<StoreFiles, PlatformError> openStoreFiles(const std::optional<std::string>& path,
                                                       size_t limit, const StopFlag& stop,
                                                       ServiceStatus* progress);

// Describes the errno `error`. If access was denied, the text also says who has access.
std::string whyNotOpened(int error);

}  // namespace tessel
