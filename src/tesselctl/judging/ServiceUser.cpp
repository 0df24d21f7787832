// Trying what another user may do.
//
// Mode bits alone would not tell: access lists, read-only mounts and security modules have a say
// too. So a child takes the user's place and asks the kernel. The child only opens and reads, and
// never writes, because a question must not change the machine.

#include "tesselctl/judging/ServiceUser.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <functional>

#include "os/UniqueFd.h"

namespace tessel::ctl {

namespace {

constexpr char kPackageUser[] = "tessel-reporter";
constexpr int kCannotTell = 255;  // as an exit status; errno values are smaller

int readFirstByte(const std::string& path) {
  // A pipe must not hold us up, so the file is opened without waiting.
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
  char byte = 0;
  return file.valid() && ::read(file.get(), &byte, 1) >= 0 ? 0 : errno;
}

int askToChange(const std::string& directory) {
  return ::access((directory + "/.").c_str(), W_OK | X_OK) == 0 ? 0 : errno;
}

bool become(uid_t user) {
  const passwd* entry = ::getpwuid(user);
  // A user without an entry has no groups but its own.
  const gid_t group = entry != nullptr ? entry->pw_gid : user;
  const bool groups =
      entry != nullptr ? ::initgroups(entry->pw_name, group) == 0 : ::setgroups(0, nullptr) == 0;
  return groups && ::setgid(group) == 0 && ::setuid(user) == 0;
}

std::optional<int> tryAs(uid_t user, const std::function<int()>& attempt) {
  if (user == ::geteuid()) return attempt();
  if (::geteuid() != 0) return {};
  const pid_t child = ::fork();
  if (child < 0) return {};
  if (child == 0) ::_exit(become(user) ? attempt() : kCannotTell);
  int status = 0;
  while (::waitpid(child, &status, 0) < 0) {
    if (errno != EINTR) return {};
  }
  if (!WIFEXITED(status) || WEXITSTATUS(status) == kCannotTell) return {};
  return WEXITSTATUS(status);
}

}  // namespace

uid_t serviceUser(const std::string& stateDirectory) {
  struct stat facts {};
  if (::stat(stateDirectory.c_str(), &facts) == 0) return facts.st_uid;
  const passwd* user = ::getpwnam(kPackageUser);
  return user != nullptr ? user->pw_uid : ::geteuid();
}

std::optional<int> tryToRead(uid_t user, const std::string& path) {
  return tryAs(user, [&] { return readFirstByte(path); });
}

std::optional<int> tryToChange(uid_t user, const std::string& directory) {
  return tryAs(user, [&] { return askToChange(directory); });
}

}  // namespace tessel::ctl
