// The lock is a POSIX record lock on the file `forwarder.lock` beside the spool.
//
// The kernel drops it with the process, so a kill leaves nothing behind, and it tells which process
// has it. flock() was discarded, because it does not tell that. The lock cannot be taken on the
// spool itself: closing a second descriptor of that file would drop the locks of SQLite.

#include "statora/ForwarderLock.h"

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <cerrno>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

namespace {

std::string processWords(pid_t process) {
  // In another container the process has no number that means anything here.
  if (process <= 0) return "a process of another container";
  std::string words = "process " + std::to_string(process);
  if (const auto name = readSmallFile("/proc/" + std::to_string(process) + "/comm", 256))
    words += " (" + plainText(trimmed(*name), " ") + ")";
  return words;
}

}  // namespace

std::variant<UniqueFd, SqliteStatus> takeForwarderLock(const std::string& stateDirectory) {
  const std::string path = stateDirectory + "/forwarder.lock";
  UniqueFd file(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0660));
  if (!file.valid()) return SqliteStatus{SQLITE_CANTOPEN, fileError(path, errno).words};
  // If root makes the file by hand, the umask must not keep the service's forwarder from it. For
  // the file of another user this fails, and changes nothing.
  static_cast<void>(::fchmod(file.get(), 0660) == 0);
  struct flock whole {};
  whole.l_type = F_WRLCK;
  if (::fcntl(file.get(), F_SETLK, &whole) == 0) return file;
  if (errno != EAGAIN && errno != EACCES)
    return SqliteStatus{SQLITE_CANTOPEN, fileError(path, errno).words};
  const bool known = ::fcntl(file.get(), F_GETLK, &whole) == 0 && whole.l_type != F_UNLCK;
  return SqliteStatus{kHeldByAnotherForwarder,
                      "another forwarder works on it: " + processWords(known ? whole.l_pid : 0)};
}

}  // namespace tessel
