// Reading and writing files.

#include "os/Files.h"

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>

namespace tessel {

namespace {

PlatformError lastError(const std::string& path) { return fileError(path, errno); }

std::string parentOf(const std::string& path) {
  const std::string parent = std::filesystem::path(path).parent_path();
  return parent.empty() ? "." : parent;
}

// Opening a pipe normally waits for its writer. Only an open descriptor tells safely what the path
// is, so we open without waiting (O_NONBLOCK) and let the caller look then.
constexpr int kOpenForReading = O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY;

// Reads to the end. The size is no help: files of /proc and /sys have a size of 0 or one page,
// whatever they hold. Absent, with errno set, if that fails or if there are more than `maximum`
// bytes (EFBIG).
std::optional<std::string> readToEnd(int file, size_t maximum) {
  std::string text;
  char buffer[4096];
  for (;;) {
    const ssize_t count = ::read(file, buffer, sizeof buffer);
    if (count == 0) return text;
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return {};
    text.append(buffer, static_cast<size_t>(count));
    if (text.size() > maximum) {
      errno = EFBIG;
      return {};
    }
  }
}

}  // namespace

std::string errorWords(int errnoValue) { return std::generic_category().message(errnoValue); }

PlatformError fileError(const std::string& what, int errnoValue) {
  return {codeOf(errnoValue), what + ": " + errorWords(errnoValue)};
}

std::optional<std::string> readSmallFile(const std::string& path, size_t maximum) {
  const UniqueFd file(::open(path.c_str(), kOpenForReading));
  struct stat facts {};
  if (!file.valid() || ::fstat(file.get(), &facts) != 0 || !S_ISREG(facts.st_mode)) return {};
  return readToEnd(file.get(), maximum);
}

std::variant<std::string, PlatformError> readOwnFile(const std::string& path, size_t maximum) {
  const auto refused = [&path](const std::string& words) {
    return PlatformError{ErrorCode::failed, path + ": " + words};
  };
  const UniqueFd file(::open(path.c_str(), kOpenForReading | O_NOFOLLOW));
  if (!file.valid()) {
    // Two error numbers tell what stands there: a link (ELOOP) or a socket (ENXIO).
    if (errno == ELOOP || errno == ENXIO) return refused("it is no regular file");
    return lastError(path);
  }
  struct stat facts {};
  struct stat directory {};
  if (::fstat(file.get(), &facts) != 0 || ::stat(parentOf(path).c_str(), &directory) != 0)
    return lastError(path);
  if (!S_ISREG(facts.st_mode)) return refused("it is no regular file");
  if (facts.st_uid != directory.st_uid) {
    return refused("it belongs to user " + std::to_string(facts.st_uid) +
                   " and not to the owner of the directory, user " +
                   std::to_string(directory.st_uid));
  }
  std::optional<std::string> text = readToEnd(file.get(), maximum);
  if (!text) return lastError(path);
  return *std::move(text);
}

std::optional<Date> fileTime(const std::string& path) {
  struct stat facts {};
  if (::lstat(path.c_str(), &facts) != 0) return {};
  return Date{
      std::chrono::duration_cast<Date::duration>(std::chrono::seconds{facts.st_mtim.tv_sec} +
                                                 std::chrono::nanoseconds{facts.st_mtim.tv_nsec})};
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
  // Only a file that we make ourselves is safe to write. A link under this name would let another
  // user choose the file that we overwrite, a pipe would keep us waiting for its reader, and a file
  // of somebody else would let him change the text later. So what stands there goes first. It may
  // also be ours, from a process that was killed while it wrote.
  if (::unlink(fresh.c_str()) != 0 && errno != ENOENT) return lastError(fresh);
  const UniqueFd file(
      ::open(fresh.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, permissions));
  if (!file.valid()) return lastError(fresh);
  const auto failed = [&fresh](const std::string& what) {
    const PlatformError error = lastError(what);
    ::unlink(fresh.c_str());  // half a text would only take room on a disk that may be full
    return error;
  };
  if (!writeAll(file.get(), text) || ::fsync(file.get()) != 0) return failed(fresh);
  if (std::rename(fresh.c_str(), path.c_str()) != 0) return failed(path);
  const std::string directory = parentOf(path);
  if (!flushDirectory(directory)) return lastError(directory);
  return {};
}

size_t allowDescriptors(size_t count) {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return count;
  if (limit.rlim_cur < count) {
    limit.rlim_cur = std::min<rlim_t>(count, limit.rlim_max);
    ::setrlimit(RLIMIT_NOFILE, &limit);
    ::getrlimit(RLIMIT_NOFILE, &limit);
  }
  return static_cast<size_t>(limit.rlim_cur);
}

}  // namespace tessel
