// A file that the user names for the output of a command, such as `report --html FILE`.
//
// Stateless. Call it on the only thread of the process: it holds signals back for a moment.

#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/Error.h"

namespace tessel::ctl {

// Puts `text` where `path` leads. Absent if that succeeded.
//
// - A regular file, or none: a new file takes its place in one step, so a reader finds all of the
//   old text or all of the new. It keeps the permissions of the old file, and its owner and group
//   as far as this user may give files away. If there was no file, only this user may read it.
//   After an error the old file stands as it was, and nothing else is left behind.
// - A link, a device or a pipe: it is opened as the `>` of a shell opens it, and written through.
//
// In a directory where everyone may make files, such as /tmp, whatever belongs to neither this user
// nor the owner of the directory is refused. Somebody else may have put it there to read the page,
// or to choose the file that root overwrites.
std::optional<PlatformError> writeOutputFile(const std::string& path, std::string_view text);

}  // namespace tessel::ctl
