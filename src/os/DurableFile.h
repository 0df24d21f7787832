// Files that must stand after a power cut.

#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace tessel {

// Makes `path` hold `text`: whoever opens it, at any time and past a power cut, finds all of the
// old text or all of the new. Writes to `<path>.new` first, which no two callers may do at a time.
// A new file has `permissions`, as far as the process's mask leaves them.
// The reason in words where that fails; the old file then still stands.
std::optional<std::string> replaceFileDurably(const std::string& path, std::string_view text,
                                              unsigned permissions = 0640);

// Makes the names in the directory, as they are now, outlast a power cut; false where that fails.
bool flushDirectory(const std::string& path);

}  // namespace tessel
