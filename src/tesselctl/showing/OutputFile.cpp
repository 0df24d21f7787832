// Replacing a file, or writing through what is no file.
//
// A page may be written for hours by cron, in a directory of many users, and read by a web server
// meanwhile. So a file is replaced by a rename. The new file has no name while it is written
// (O_TMPFILE): whatever ends us, a full disk, SIGKILL or a power cut, leaves nothing behind. It
// gets a random name only for the moment before the rename, because a file without a name can take
// no name that is in use. A fixed name would let another user wait for it.
//
// A rename must not touch a device or a link, since as root it would turn /dev/null into a file. We
// look at what stands there without following a link. If it is a link, the kernel follows it while
// it opens it. We never read where it leads: another user could change it before we open that
// place, and the kernel would no longer know that a link of a stranger led us there.

#include "tesselctl/showing/OutputFile.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <random>

#include "os/Files.h"
#include "os/UniqueFd.h"

namespace tessel::ctl {

namespace {

// The owner alone: a page shows what programs recorded, and a umask may let everyone read.
constexpr mode_t kNewMode = 0600;

// Holds every signal back that can be held back, until the end of its life.
class SignalsHeld {
 public:
  SignalsHeld() {
    sigset_t all;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before_);
  }
  SignalsHeld(const SignalsHeld&) = delete;
  SignalsHeld& operator=(const SignalsHeld&) = delete;
  ~SignalsHeld() { pthread_sigmask(SIG_SETMASK, &before_, nullptr); }

 private:
  sigset_t before_{};
};

// The place that a path names: a name in an open directory. A rename of the directory, or another
// one put in its place, then changes nothing for us.
struct Place {
  UniqueFd directory;
  std::string name;
  struct stat directoryFacts {};
  bool exists = false;
  struct stat facts {};  // if it exists; of a link itself
};

std::string randomName() {
  std::random_device random;
  std::array<char, 32> name{};
  std::snprintf(name.data(), name.size(), ".tesselctl-%08x%08x", random(), random());
  return name.data();
}

// The functions below answer an errno value, 0 for success.

int findPlace(const std::string& path, Place& place) {
  if (path.empty()) return ENOENT;
  const size_t slash = path.rfind('/');
  place.name = slash == std::string::npos ? path : path.substr(slash + 1);
  if (place.name.empty() || place.name == "." || place.name == "..") return EISDIR;
  const std::string directory = slash == std::string::npos ? "." : path.substr(0, slash + 1);
  // O_PATH asks for no right to list the directory, which writing a file does not need.
  place.directory = UniqueFd(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!place.directory.valid() || ::fstat(place.directory.get(), &place.directoryFacts) != 0)
    return errno;
  place.exists =
      ::fstatat(place.directory.get(), place.name.c_str(), &place.facts, AT_SYMLINK_NOFOLLOW) == 0;
  return place.exists || errno == ENOENT ? 0 : errno;
}

// The kernel has this rule too, but not every machine switches it on (fs.protected_symlinks and its
// like). In a sticky directory nobody can replace the file of another, so the answer still holds
// when we open the file.
bool isOfAStranger(const Place& place) {
  const mode_t mode = place.directoryFacts.st_mode;
  const bool shared = (mode & S_IWOTH) != 0 || ((mode & S_ISVTX) != 0 && (mode & S_IWGRP) != 0);
  return place.exists && shared && place.facts.st_uid != ::geteuid() &&
         place.facts.st_uid != place.directoryFacts.st_uid;
}

// O_CREAT makes what a dangling link leads to, as in a shell. It also asks the kernel for its own
// rules about pipes and files in sticky directories.
int writeThrough(const Place& place, std::string_view text) {
  UniqueFd file(::openat(place.directory.get(), place.name.c_str(),
                         O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOCTTY, kNewMode));
  if (!file.valid() || !writeAll(file.get(), text)) return errno;
  // A network file system may report a full disk only here.
  return ::close(file.release()) == 0 ? 0 : errno;
}

// A file of `mode` like the old one. Only root may give a file away, and others may give it only to
// a group of their own. A group that is not the old one gets no rights.
int takeOver(int file, const Place& place) {
  if (!place.exists) return ::fchmod(file, kNewMode) == 0 ? 0 : errno;
  mode_t mode = place.facts.st_mode & 0777;
  if (::fchown(file, place.facts.st_uid, place.facts.st_gid) != 0 &&
      ::fchown(file, static_cast<uid_t>(-1), place.facts.st_gid) != 0)
    mode &= ~static_cast<mode_t>(S_IRWXG);
  return ::fchmod(file, mode) == 0 ? 0 : errno;
}

// Opens a new file in the directory. `name` stays empty if it has none. Not every file system has
// files without a name, and only /proc gives them one later.
UniqueFd openNew(const Place& place, std::string& name) {
  if (::access("/proc/self/fd", X_OK) == 0) {
    UniqueFd file(::openat(place.directory.get(), ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, kNewMode));
    if (file.valid()) return file;
  }
  name = randomName();
  UniqueFd file(::openat(place.directory.get(), name.c_str(),
                         O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kNewMode));
  if (!file.valid()) name.clear();
  return file;
}

int replaceFile(const Place& place, std::string_view text) {
  // A signal between the new file and its rename would leave the new one behind.
  const SignalsHeld held;
  const int directory = place.directory.get();
  std::string name;
  const UniqueFd file = openNew(place, name);
  if (!file.valid()) return errno;
  int error = takeOver(file.get(), place);
  // The flush comes before the rename: after a power cut the file must not stand there empty.
  if (error == 0 && (!writeAll(file.get(), text) || ::fsync(file.get()) != 0)) error = errno;
  if (error == 0 && name.empty()) {
    const std::string nameless = "/proc/self/fd/" + std::to_string(file.get());
    name = randomName();
    if (::linkat(AT_FDCWD, nameless.c_str(), directory, name.c_str(), AT_SYMLINK_FOLLOW) != 0)
      return errno;
  }
  if (error == 0 && ::renameat(directory, name.c_str(), directory, place.name.c_str()) != 0)
    error = errno;
  if (error != 0 && !name.empty()) ::unlinkat(directory, name.c_str(), 0);
  return error;
}

}  // namespace

std::optional<PlatformError> writeOutputFile(const std::string& path, std::string_view text) {
  Place place;
  int error = findPlace(path, place);
  if (error == 0 && isOfAStranger(place)) {
    return PlatformError{ErrorCode::failed, path + ": it belongs to user " +
                                                std::to_string(place.facts.st_uid) +
                                                ", in a directory where everyone may make files"};
  }
  if (error == 0) {
    const bool file = !place.exists || S_ISREG(place.facts.st_mode);
    error = file ? replaceFile(place, text) : writeThrough(place, text);
  }
  if (error == 0) return {};
  return fileError(path, error);
}

}  // namespace tessel::ctl
