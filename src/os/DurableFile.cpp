// Write, flush, rename, flush.

#include "os/DurableFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>

#include "os/Files.h"
#include "os/UniqueFd.h"

namespace tessel {

namespace {

std::string lastError(const std::string& path) {
  const int error = errno;
  return path + ": " + errorWords(error);
}

}  // namespace

bool flushDirectory(const std::string& path) {
  const UniqueFd directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return directory.valid() && ::fsync(directory.get()) == 0;
}

std::optional<std::string> replaceFileDurably(const std::string& path, std::string_view text,
                                              unsigned permissions) {
  const std::string fresh = path + ".new";
  const UniqueFd file(
      ::open(fresh.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, permissions));
  if (!file.valid() || !writeAll(file.get(), text) || ::fsync(file.get()) != 0) {
    return lastError(fresh);
  }
  if (std::rename(fresh.c_str(), path.c_str()) != 0) return lastError(path);
  const std::string directory = std::filesystem::path(path).parent_path();
  if (!flushDirectory(directory.empty() ? "." : directory)) return lastError(directory);
  return {};
}

}  // namespace tessel
