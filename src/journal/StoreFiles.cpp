// Lists directories until a listing shows nothing new.

#include "journal/StoreFiles.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <set>
#include <string_view>
#include <utility>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// The files of a machine lie one directory deep, collected ones a few. The bound is needed because
// each level keeps a descriptor open and mounts may form a loop.
constexpr int kDeepestDirectory = 32;
// Two listings are usual. If each listing finds a new file, somebody fills the place on purpose.
constexpr int kMostListings = 8;

std::optional<StoreFileKind> kindOf(std::string_view name) {
  if (name.ends_with(".journal") || name.ends_with(".journal~")) return StoreFileKind::journal;
  if (name.ends_with(".export")) return StoreFileKind::exportStream;
  return std::nullopt;
}

class Finder {
 public:
  Finder(size_t limit, const StopFlag& stop, ServiceStatus* status)
      : limit_(limit), stop_(stop), status_(status) {}

  // Lists `directory` until a listing shows nothing new. Returns 0, or errno if it cannot be read.
  int addDirectory(const std::string& directory);
  // Adds the journals of `machine` under `place`, those of its namespaces included.
  int addMachine(const std::string& place, const std::string& machine);
  void addFile(const std::string& path, StoreFileKind kind);
  StoreFiles take();

 private:
  int list(const std::string& directory, int depth);
  void fail(const std::string& path, StoreFileKind kind, int error);
  void visit(const std::string& path, const dirent& entry, int depth);

  const size_t limit_;
  const StopFlag& stop_;
  ServiceStatus* const status_;
  StoreFiles found_;
  std::set<std::pair<dev_t, ino_t>> known_;
  std::vector<StoreFile> failed_;  // files that the current listing could not open
};

int Finder::addDirectory(const std::string& directory) {
  int error = 0;
  size_t before = SIZE_MAX;
  const size_t failedElsewhere = failed_.size();
  const uint64_t leftOutElsewhere = found_.leftOut;
  for (int i = 0; i < kMostListings && before != known_.size() && !stop_.load(); ++i) {
    before = known_.size();
    // Only failures of the last listing count: a file that fails in one listing and not in the next
    // was renamed or removed in between.
    failed_.erase(failed_.begin() + static_cast<ptrdiff_t>(failedElsewhere), failed_.end());
    found_.leftOut = leftOutElsewhere;
    error = list(directory, 0);
    if (error != 0) break;
  }
  return error;
}

// A service with LogNamespace= writes to a daemon of its own, which keeps its files beside those of
// the main one, in a directory named after the machine and the namespace.
int Finder::addMachine(const std::string& place, const std::string& machine) {
  const std::unique_ptr<DIR, int (*)(DIR*)> listing(::opendir(place.c_str()), ::closedir);
  while (const dirent* entry = listing ? ::readdir(listing.get()) : nullptr) {
    const std::string name = entry->d_name;
    if (!name.starts_with(machine + ".") || stop_.load(std::memory_order_relaxed)) continue;
    const int error = addDirectory(place + "/" + name);
    if (error != 0 && error != ENOENT && error != ENOTDIR)
      fail(place + "/" + name, StoreFileKind::journal, error);
  }
  return addDirectory(place + "/" + machine);
}

int Finder::list(const std::string& directory, int depth) {
  const std::unique_ptr<DIR, int (*)(DIR*)> listing(::opendir(directory.c_str()), ::closedir);
  if (!listing) return errno;
  while (const dirent* entry = ::readdir(listing.get())) {
    if (stop_.load(std::memory_order_relaxed)) break;
    visit(directory + "/" + entry->d_name, *entry, depth);
  }
  return 0;
}

void Finder::visit(const std::string& path, const dirent& entry, int depth) {
  const std::string_view name = entry.d_name;
  if (name == "." || name == "..") return;
  bool isDirectory = entry.d_type == DT_DIR;
  if (entry.d_type == DT_UNKNOWN) {  // some file systems do not tell
    struct stat status {};
    isDirectory = ::lstat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
  }
  if (!isDirectory) {
    if (const auto kind = kindOf(name)) addFile(path, *kind);
    return;
  }
  if (depth >= kDeepestDirectory) return;  // unreported: no tool of the journal nests so deep
  const int error = list(path, depth + 1);
  // A directory that vanished was rotated away. Any other error may hide journals and is reported.
  if (error != 0 && error != ENOENT) fail(path, StoreFileKind::journal, error);
}

// Opens the file first and then asks whether it is a regular one; the other way round, somebody
// could exchange it in between. So it may be a pipe, and O_NONBLOCK keeps open() from waiting for
// the pipe's other end.
void Finder::addFile(const std::string& path, StoreFileKind kind) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!fd.valid()) {
    if (errno != ENOENT) fail(path, kind, errno);
    return;
  }
  if (status_ != nullptr) status_->progress();
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return;
  // One file can have two names, by a hard or symbolic link or a rename between two listings. We
  // take it once; otherwise each of its entries would be read twice.
  const std::pair identity(status.st_dev, status.st_ino);
  if (known_.count(identity) != 0) return;
  if (known_.size() >= limit_) {
    ++found_.leftOut;
    return;
  }
  known_.insert(identity);
  found_.files.push_back({path, kind, std::move(fd), 0});
}

void Finder::fail(const std::string& path, StoreFileKind kind, int error) {
  if (failed_.size() < limit_) {
    failed_.push_back({path, kind, {}, error});
  } else {
    ++found_.leftOut;
  }
}

StoreFiles Finder::take() {
  std::move(failed_.begin(), failed_.end(), std::back_inserter(found_.files));
  // The order of a listing differs from run to run; reports should not.
  std::sort(found_.files.begin(), found_.files.end(),
            [](const StoreFile& a, const StoreFile& b) { return a.path < b.path; });
  return std::move(found_);
}

PlatformError storeError(const std::string& path, int error) {
  return {codeOf(error), path + ": " + whyNotOpened(error)};
}

// The daemon keeps its files under /var/log/journal if that directory exists, otherwise under /run.
// If the directory was made later, each place holds a part of the journal. So we read both, and it
// is no error if one of them is absent.
std::variant<StoreFiles, PlatformError> machineJournal(Finder& finder) {
  // Other machines' journals may lie beside ours, in directories named after their ids.
  const std::string machine(trimmed(readSmallFile("/etc/machine-id", 4096).value_or("")));
  if (machine.empty())
    return PlatformError{ErrorCode::notFound,
                         "/etc/machine-id: the machine has no identity, so no journal"};
  bool found = false;
  for (const std::string place : {"/var/log/journal", "/run/log/journal"}) {
    const int error = finder.addMachine(place, machine);
    if (error != 0 && error != ENOENT) return storeError(place + "/" + machine, error);
    found = found || error == 0;
  }
  if (!found)
    return PlatformError{ErrorCode::notFound, "/var/log/journal/" + machine +
                                                  ": the machine keeps no journal, here or under "
                                                  "/run/log/journal"};
  return finder.take();
}

}  // namespace

std::string whyNotOpened(int error) {
  std::string text = errorWords(error);
  if (error == EACCES || error == EPERM)
    text += " (members of the group systemd-journal may read the journal)";
  return text;
}

std::variant<StoreFiles, PlatformError> openStoreFiles(const std::optional<std::string>& path,
                                                       size_t limit, const StopFlag& stop,
                                                       ServiceStatus* progress) {
  constexpr size_t kOtherFiles = 256;  // descriptors for everything else in the process
  // Every file of the store stays open. The usual soft limit of 1,024 protects programs that use
  // select(); we do not, so we raise it. Where the hard limit is too low, we look at fewer files.
  // If the store took every descriptor, the spool could not be opened and all rows would be lost.
  const size_t allowed = allowDescriptors(limit + kOtherFiles);
  const size_t forStore = allowed > 2 * kOtherFiles ? allowed - kOtherFiles : allowed / 2;
  Finder finder(std::min(limit, forStore), stop, progress);
  if (!path) return machineJournal(finder);
  struct stat status {};
  if (::stat(path->c_str(), &status) != 0) return storeError(*path, errno);
  if (!S_ISDIR(status.st_mode)) {
    if (!S_ISREG(status.st_mode))
      return PlatformError{ErrorCode::notAStore, *path + ": neither a directory nor a file"};
    // A single file may have any name. Without a known ending it is read as a journal file.
    finder.addFile(*path, kindOf(*path).value_or(StoreFileKind::journal));
  } else if (const int error = finder.addDirectory(*path)) {
    return storeError(*path, error);
  }
  return finder.take();
}

}  // namespace tessel
