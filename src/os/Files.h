// What every room that touches the file system shares: errors in words, small files, new files, and
// files that outlast a power cut.
//
// Stateless; any thread, unless a function says otherwise.

#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "os/UniqueFd.h"
#include "platform/Error.h"

namespace tessel {

// What an errno value means, in words.
std::string errorWords(int errnoValue);
// The error about a file: its code, and "what: words". `what` names the file.
PlatformError fileError(const std::string& what, int errnoValue);

// The whole of a regular, proc or sysfs file. Absent where it cannot be opened or read, is no file,
// or holds more than `maximum` bytes. Never waits for the writer of a pipe.
std::optional<std::string> readSmallFile(const std::string& path, size_t maximum);

// Writes all of `text`; false with errno set where that fails.
bool writeAll(int fd, std::string_view text);

// Makes an empty file with `permissions`, as far as the mask of the process leaves them. False with
// errno set where that fails; EEXIST where anything stands there, a broken link included.
bool createNewFile(const std::string& path, unsigned permissions);

// A descriptor of the directory, for flock(), fsync() and the *at() functions. Not valid, with
// errno set, where it cannot be opened.
UniqueFd openDirectory(const std::string& path);

// Makes `path` hold `text`. Whoever opens it, at any time and after a power cut, finds all of the
// old text or all of the new. Writes `<path>.new` first, so two callers must not write one path at
// the same time. A new file has `permissions`, as far as the mask of the process leaves them.
// Absent where that succeeded. After an error the old file still stands, unless it was the
// flushing of the directory that failed: then either may stand after a power cut.
std::optional<PlatformError> replaceFileDurably(const std::string& path, std::string_view text,
                                                unsigned permissions = 0640);

// Makes the present names in the directory outlast a power cut; false where that fails.
bool flushDirectory(const std::string& path);

}  // namespace tessel
