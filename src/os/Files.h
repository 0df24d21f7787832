// File functions for every room that touches the file system: errors in words, small files, new
// files, and files that survive a power cut.
//
// Stateless; any thread, unless a function says otherwise.

#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "os/UniqueFd.h"
#include "platform/Error.h"
#include "platform/System.h"

namespace tessel {

// The words for an errno value.
std::string errorWords(int errnoValue);
// The error for an errno value. Its words are "what: errorWords()"; `what` names the file.
PlatformError fileError(const std::string& what, int errnoValue);

// The whole content of a regular, proc or sysfs file. Absent if it cannot be opened or read, is
// something else (a directory, a pipe), or holds more than `maximum` bytes. Never waits for the
// writer of a pipe.
std::optional<std::string> readSmallFile(const std::string& path, size_t maximum);

// The whole content of a file that a service keeps in a directory of its own. Others may write to
// that directory too, so the file must be a regular file, no link, and belong to the owner of the
// directory. The error says what it is instead. Never waits, whatever stands at the path.
std::variant<std::string, PlatformError> readOwnFile(const std::string& path, size_t maximum);

// When the content of the file was last written. For a link, when the link was made. Absent if
// there is no such path, or if it may not be looked at.
std::optional<Date> fileTime(const std::string& path);

// Writes all of `text`. False, with errno set, if that fails.
bool writeAll(int fd, std::string_view text);

// Makes an empty file with `permissions`, less the umask of the process. False, with errno set, if
// that fails. errno is EEXIST if the path exists already, even as a broken link.
bool createNewFile(const std::string& path, unsigned permissions);

// A descriptor of the directory, for flock(), fsync() and the *at() functions. If the directory
// cannot be opened, the result is not valid() and errno is set.
UniqueFd openDirectory(const std::string& path);

// Replaces the content of `path` by `text`. A reader finds all of the old text or all of the new,
// at any moment and after a power cut. The text goes to a new file `<path>.new` first. Whatever
// stood under that name is removed, unless it is a directory. So two callers must not write the
// same path at the same time. The file has `permissions`, less the umask of the process.
//
// Absent if that succeeded. After an error `path` still holds the old text, with one exception: if
// only the flush of the directory failed, it holds the new text, which a power cut may undo.
// RLIMIT_FSIZE counts as an error only in a process that ignores SIGXFSZ.
std::optional<PlatformError> replaceFileDurably(const std::string& path, std::string_view text,
                                                unsigned permissions = 0640);

// Makes the names that stand in the directory now survive a power cut. False if that fails.
bool flushDirectory(const std::string& path);

// Raises this process's soft limit on descriptors to `count`, as far as the hard limit allows.
// Returns the soft limit.
size_t allowDescriptors(size_t count);

}  // namespace tessel
