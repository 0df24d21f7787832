// Reading and writing files.

#include "os/Files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>

namespace tessel {

namespace {

PlatformError lastError(const std::string& path) { return fileError(path, errno); }

}  // namespace

std::string errorWords(int errnoValue) { return std::generic_category().message(errnoValue); }

PlatformError fileError(const std::string& what, int errnoValue) {
  return {codeOf(errnoValue), what + ": " + errorWords(errnoValue)};
}

std::optional<std::string> readSmallFile(const std::string& path, size_t maximum) {
  // Opening a pipe normally waits for its writer. Only an open descriptor tells safely what the
  // path is, so we open without waiting (O_NONBLOCK) and look then.
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  struct stat facts {};
  if (!file.valid() || ::fstat(file.get(), &facts) != 0 || !S_ISREG(facts.st_mode)) return {};
  // We read until the end, because the size is no help: files of /proc and /sys have a size of 0 or
  // one page, whatever they hold.
  std::string text;
  char buffer[4096];
  for (;;) {
    const ssize_t count = ::read(file.get(), buffer, sizeof buffer);
    if (count == 0) return text;
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return {};
    text.append(buffer, static_cast<size_t>(count));
    if (text.size() > maximum) return {};
  }
}

bool writeAll(int fd, std::string_view text) {
  while (!text.empty()) {
    const ssize_t count = ::write(fd, text.data(), text.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    text.remove_prefix(static_cast<size_t>(count));
  }
  return true;
}

bool createNewFile(const std::string& path, unsigned permissions) {
  return UniqueFd(
             ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOCTTY, permissions))
      .valid();
}

UniqueFd openDirectory(const std::string& path) {
  return UniqueFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

bool flushDirectory(const std::string& path) {
  const UniqueFd directory = openDirectory(path);
  return directory.valid() && ::fsync(directory.get()) == 0;
}

// Writing in place would leave half a text after a power cut. A rename is all or nothing, but the
// file system may put it on disk before the data, and a power cut would then leave an empty file.
// So we flush the data before the rename, and the directory after it. The price is two waits for
// the disk, which is small for files that are written a few times a day.
std::optional<PlatformError> replaceFileDurably(const std::string& path, std::string_view text,
                                                unsigned permissions) {
  const std::string fresh = path + ".new";
  // O_NOFOLLOW: a link under this name would let another user choose the file that we overwrite.
  const UniqueFd file(
      ::open(fresh.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, permissions));
  if (!file.valid() || !writeAll(file.get(), text) || ::fsync(file.get()) != 0)
    return lastError(fresh);
  if (std::rename(fresh.c_str(), path.c_str()) != 0) return lastError(path);
  const std::string parent = std::filesystem::path(path).parent_path();
  const std::string directory = parent.empty() ? "." : parent;
  if (!flushDirectory(directory)) return lastError(directory);
  return {};
}

}  // namespace tessel
