// Small helpers of this room around file descriptors and errno.

#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace tessel {

// What an errno value means, in words.
std::string errorWords(int errnoValue);

// The whole of a regular, proc or sysfs file; nothing where it cannot be opened or read, is
// something else than a file, or holds more than `maximum` bytes. Never waits for a writer.
std::optional<std::string> readSmallFile(const std::string& path, size_t maximum);

// Writes all of `text`; false with errno set where that fails.
bool writeAll(int fd, std::string_view text);

}  // namespace tessel
