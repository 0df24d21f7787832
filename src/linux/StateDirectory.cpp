// The state directory on disk.

#include "linux/StateDirectory.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <filesystem>
#include <system_error>

#include "os/DurableFile.h"
#include "os/Files.h"
#include "platform/PlainText.h"

namespace tessel {

namespace {

constexpr mode_t kDirectoryMode = 0750;
constexpr size_t kMaxRecordSize = 64;

// A slash at the end would pass for a name of its own when the directory above is looked for.
std::string withoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

// Makes the directory and what is missing above it; the errno of what went wrong, or 0.
int makeDirectory(const std::string& path) {
  const std::filesystem::path parent = std::filesystem::path(path).parent_path();
  std::error_code error;
  if (!parent.empty()) std::filesystem::create_directories(parent, error);
  if (error) return error.value();
  if (::mkdir(path.c_str(), kDirectoryMode) == 0) return 0;
  struct stat facts {};
  if (errno != EEXIST || ::stat(path.c_str(), &facts) != 0) return errno;
  return S_ISDIR(facts.st_mode) ? 0 : ENOTDIR;
}

// For flock(): the directory itself, which can be locked also where it cannot be written to.
UniqueFd openForLocking(const std::string& directory) {
  return UniqueFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

}  // namespace

std::variant<StateDirectory, std::string> StateDirectory::open(const std::string& path) {
  const std::string plain = withoutTrailingSlashes(path);
  const std::string shown = "state directory " + plainText(plain, "\\x0a") + ": ";
  if (const int error = makeDirectory(plain)) return shown + errorWords(error);
  if (!openForLocking(plain).valid()) return shown + errorWords(errno);
  return StateDirectory(plain);
}

std::optional<RunLock> StateDirectory::lock(int operation) const {
  UniqueFd directory = openForLocking(path_);
  if (!directory.valid()) return {};
  while (::flock(directory.get(), operation) != 0) {
    if (errno != EINTR) return {};
  }
  return RunLock(std::move(directory));
}

std::optional<RunLock> StateDirectory::tryLock() const { return lock(LOCK_EX | LOCK_NB); }

std::optional<RunLock> StateDirectory::waitForLock() const { return lock(LOCK_EX); }

std::optional<Date> StateDirectory::lastRun() const {
  const std::optional<std::string> text = readSmallFile(recordFile(), kMaxRecordSize);
  if (!text || !text->ends_with('\n')) return {};
  int64_t microseconds = 0;
  const char* end = text->data() + text->size() - 1;
  const auto [stopped, error] = std::from_chars(text->data(), end, microseconds);
  if (error != std::errc() || stopped != end || microseconds < 0) return {};
  return Date(std::chrono::microseconds{microseconds});
}

std::optional<std::string> StateDirectory::recordRun(Date begin) const {
  return replaceFileDurably(recordFile(), std::to_string(begin.time_since_epoch().count()) + '\n');
}

}  // namespace tessel
