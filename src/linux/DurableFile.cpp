// Write, flush, rename, flush.

#include "linux/DurableFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>

namespace tessel {

namespace {

std::string lastError(const std::string& path) {
  return path + ": " + std::generic_category().message(errno);
}

bool writeAll(int file, std::string_view text) {
  while (!text.empty()) {
    const ssize_t count = ::write(file, text.data(), text.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    text.remove_prefix(static_cast<size_t>(count));
  }
  return ::fsync(file) == 0;
}

bool flushDirectory(const std::string& path) {
  const int directory = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (directory < 0) return false;
  const bool flushed = ::fsync(directory) == 0;
  ::close(directory);
  return flushed;
}

}  // namespace

std::optional<std::string> replaceFileDurably(const std::string& path, std::string_view text) {
  const std::string fresh = path + ".new";
  const int file =
      ::open(fresh.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0640);
  if (file < 0) return lastError(fresh);
  std::optional<std::string> failure;
  if (!writeAll(file, text)) failure = lastError(fresh);
  ::close(file);
  if (failure) return failure;
  if (std::rename(fresh.c_str(), path.c_str()) != 0) return lastError(path);
  const std::string directory = std::filesystem::path(path).parent_path();
  if (!flushDirectory(directory.empty() ? "." : directory)) return lastError(directory);
  return {};
}

}  // namespace tessel
