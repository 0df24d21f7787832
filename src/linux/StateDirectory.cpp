// The state directory on disk, and the removal of a marker.
//
// The run marker is a file, but anybody who may write to its directory can put a directory there. A
// marker that cannot be removed would stop all later runs. So we remove a directory with its whole
// content. The service may run as root, so nobody may lead this walk to other files:
//  - It goes from descriptor to descriptor (openat with O_NOFOLLOW), never by path. So it follows
//    no link, even one that somebody puts there between two steps.
//  - It enters no other mount: it must not empty a file system that is mounted below the marker.
//  - Its depth is bounded, because each level holds a descriptor.
// std::filesystem::remove_all was discarded: it crosses mounts.

#include "linux/StateDirectory.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <filesystem>
#include <memory>
#include <string>
#include <system_error>
#include <tuple>
#include <utility>

#include "linux/RunRecordFile.h"
#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

namespace {

constexpr mode_t kDirectoryMode = 0750;
constexpr size_t kMaxRecordSize = 64;  // a decimal 64-bit number and a line feed take 21

// parent_path() of "/a/b/" is "/a/b", and we need "/a".
std::string withoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

// Makes the directory and the missing ones above it. Answers 0 or the errno of the failure. Only
// the directory itself gets kDirectoryMode, so it has a call of its own.
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

// The number in a record. Absent if there is none or it cannot be understood.
std::optional<int64_t> recordedNumber(const std::string& path) {
  const auto content = readOwnFile(path, kMaxRecordSize);
  const auto* text = std::get_if<std::string>(&content);
  // A record without its line feed was cut short, so its number may be incomplete.
  if (text == nullptr || !text->ends_with('\n')) return {};
  int64_t number = 0;
  const char* end = text->data() + text->size() - 1;
  const auto [stopped, error] = std::from_chars(text->data(), end, number);
  if (error != std::errc() || stopped != end || number < 0) return {};
  return number;
}

}  // namespace

// A run as another user, which only root can do, would leave files that all later runs of the owner
// cannot write: the rows of those runs would be lost without end.
std::variant<StateDirectory, PlatformError> StateDirectory::open(const std::string& path) {
  const std::string plain = withoutTrailingSlashes(path);
  const std::string shown = "state directory " + plainText(plain, "\\x0a");
  if (const int error = makeDirectory(plain)) return fileError(shown, error);
  const UniqueFd directory = openDirectory(plain);
  struct stat facts {};
  if (!directory.valid() || ::fstat(directory.get(), &facts) != 0) return fileError(shown, errno);
  if (facts.st_uid != ::geteuid()) {
    return PlatformError{ErrorCode::noAccess,
                         shown + ": it belongs to user " + std::to_string(facts.st_uid) +
                             ", and this process runs as user " + std::to_string(::geteuid())};
  }
  return StateDirectory(plain);
}

std::optional<RunLock> StateDirectory::lock(int operation) const {
  // The directory itself can be locked even where no file can be made in it.
  UniqueFd directory = openDirectory(path_);
  if (!directory.valid()) return {};
  while (::flock(directory.get(), operation) != 0) {
    if (errno != EINTR) return {};
  }
  return RunLock(std::move(directory));
}

bool StateDirectory::isLocked() const {
  const UniqueFd directory = openDirectory(path_);
  return directory.valid() && ::flock(directory.get(), LOCK_SH | LOCK_NB) != 0 &&
         errno == EWOULDBLOCK;
}

std::optional<RunLock> StateDirectory::tryLock() const { return lock(LOCK_EX | LOCK_NB); }

std::optional<RunLock> StateDirectory::waitForLock() const { return lock(LOCK_EX); }

std::optional<Date> StateDirectory::lastRun() const {
  const std::optional<int64_t> microseconds = recordedNumber(recordFile());
  if (!microseconds) return {};
  return Date(std::chrono::microseconds{*microseconds});
}

std::vector<PlatformError> StateDirectory::refusedFiles() const {
  std::vector<PlatformError> refused;
  const std::pair<std::string, size_t> kFiles[] = {{recordFile(), kMaxRecordSize},
                                                   {putOffFile(), kMaxRecordSize},
                                                   {runRecordPath(path_), kMaxRunRecordBytes}};
  for (const auto& [path, maximum] : kFiles) {
    auto content = readOwnFile(path, maximum);
    auto* error = std::get_if<PlatformError>(&content);
    if (error != nullptr && error->code != ErrorCode::notFound)
      refused.push_back(std::move(*error));
  }
  return refused;
}

std::optional<PlatformError> StateDirectory::recordRun(Date begin) const {
  return replaceFileDurably(recordFile(), std::to_string(begin.time_since_epoch().count()) + '\n');
}

std::chrono::seconds StateDirectory::putOff() const {
  // The caller adds to it, in nanoseconds. A year leaves room for that.
  constexpr int64_t kMost = 31'536'000;
  return std::chrono::seconds{std::min(recordedNumber(putOffFile()).value_or(0), kMost)};
}

std::optional<PlatformError> StateDirectory::recordPutOff(std::chrono::seconds time) const {
  return replaceFileDurably(putOffFile(), std::to_string(time.count()) + '\n');
}

namespace {

constexpr int kOpenDirectory = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Identifies a mount. The device is not enough, because a bind mount of the same file system has
// the same device.
using MountKey = std::tuple<uint64_t, uint32_t, uint32_t>;

std::optional<MountKey> mountOf(int directory) {
  struct statx facts {};
  if (::statx(directory, "", AT_EMPTY_PATH | AT_NO_AUTOMOUNT, STATX_MNT_ID, &facts) != 0) return {};
  return MountKey{facts.stx_mnt_id, facts.stx_dev_major, facts.stx_dev_minor};
}

struct CloseDirectory {
  void operator()(DIR* directory) const { ::closedir(directory); }
};
using Directory = std::unique_ptr<DIR, CloseDirectory>;

// Removes a tree on one mount. It keeps the first error and goes on, so that as little as possible
// is left.
class Remover {
 public:
  explicit Remover(MountKey mount) : mount_(mount) {}

  // Removes `name` in the directory `parent`. `path` names it in errors.
  bool remove(int parent, const char* name, const std::string& path, int depth) {
    // Remove it as a file first. If we looked before, it could become something else in between.
    if (::unlinkat(parent, name, 0) == 0) return true;
    const int error = errno;
    if (!isDirectory(parent, name)) return failed(fileError(path, error));
    if (!removeContents(parent, name, path, depth)) return false;
    return ::unlinkat(parent, name, AT_REMOVEDIR) == 0 || failed(fileError(path, errno));
  }
  const std::optional<PlatformError>& error() const { return error_; }

 private:
  static bool isDirectory(int parent, const char* name) {
    struct stat facts {};
    return ::fstatat(parent, name, &facts, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(facts.st_mode);
  }

  bool removeContents(int parent, const char* name, const std::string& path, int depth) {
    if (depth == LocalFiles::kMaxRemovalDepth)
      return failed({ErrorCode::failed, path + ": nested too deeply"});
    UniqueFd fd(::openat(parent, name, kOpenDirectory));
    if (!fd.valid()) return failed(fileError(path, errno));
    if (mountOf(fd.get()) != mount_)
      return failed({ErrorCode::failed, path + ": something is mounted here"});
    const Directory directory(::fdopendir(fd.get()));
    if (!directory) return failed(fileError(path, errno));
    const int inside = fd.release();  // closedir() closes it
    bool removedAll = true;
    while (const dirent* entry = ::readdir(directory.get())) {
      const std::string_view item = entry->d_name;
      if (item == "." || item == "..") continue;
      removedAll =
          remove(inside, entry->d_name, path + "/" + entry->d_name, depth + 1) && removedAll;
    }
    return removedAll;
  }

  bool failed(PlatformError error) {
    if (!error_) error_ = std::move(error);
    return false;
  }

  const MountKey mount_;
  std::optional<PlatformError> error_;
};

}  // namespace

FileExistence LocalFiles::existence(const std::string& path) {
  struct stat facts {};
  if (::lstat(path.c_str(), &facts) != 0) return {};
  return {true, S_ISDIR(facts.st_mode)};
}

// The test and the creation are one step, so no other process can make the file in between.
std::optional<PlatformError> LocalFiles::createFile(const std::string& path) {
  if (createNewFile(path, 0666)) return {};
  return fileError(path, errno);
}

RemovalResult LocalFiles::remove(const std::string& path) {
  const std::filesystem::path whole(path);
  // A marker is a file nearly always, and removing a file takes no descriptor. So a process that
  // has run out of descriptors still removes its marker.
  if (::unlink(path.c_str()) == 0) return {true, {}};
  const std::string parentPath = whole.has_parent_path() ? whole.parent_path().string() : ".";
  const UniqueFd parent = openDirectory(parentPath);
  const std::optional<MountKey> mount = parent.valid() ? mountOf(parent.get()) : std::nullopt;
  if (!mount) return {false, fileError(parentPath, errno)};
  Remover remover(*mount);
  if (remover.remove(parent.get(), whole.filename().c_str(), path, 0)) return {true, {}};
  return {false, remover.error()};
}

}  // namespace tessel
