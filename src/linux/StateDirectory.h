// Files that outlive the process: the state directory, and the file operations for the run marker.

#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "os/UniqueFd.h"
#include "platform/Error.h"
#include "platform/System.h"

namespace tessel {

// What `tesselctl status --save` found, as JSON: a file of the directory's owner, which the
// forwarder reads.
inline constexpr char kSavedStatusName[] = "status.json";

// Holds the right to run until it is destroyed or the process ends.
class RunLock {
 public:
  explicit RunLock(UniqueFd directory) : directory_(std::move(directory)) {}

 private:
  UniqueFd directory_;  // closing it releases the lock
};

// The directory for what outlives the process, and the scheduler's files in it.
//
//   scheduler-last-run  when the last run began that has ended and was not deferred: microseconds
//                       since 1970, decimal, and a line feed. Only the holder of the lock writes
//                       it.
//   scheduler-put-off   for how many seconds the machine has put off the run that is due: decimal,
//                       and a line feed
//   status.json         what `tesselctl status --save` found last
//   defer               other programs make and remove it; while it exists, runs are deferred
//
// A file that the service reads here is a regular file of the directory's owner. Anything else
// under its name counts as no file; refusedFiles() says why. The next write puts our own file
// there.
//
// The service also runs with a directory that it cannot write. A run then loses its record and its
// events, and the log says so. Immutable; any thread may use it.
class StateDirectory {
 public:
  // Makes the directory (mode 0750) if it is missing. The error is one line that names the
  // directory and the reason: it cannot be made, is no directory, cannot be read, or belongs to
  // another user than this process runs as. Then nothing in it has been touched.
  static std::variant<StateDirectory, PlatformError> open(const std::string& path);
  // The directory for those who only look. Makes nothing.
  static StateDirectory forReading(std::string path) { return StateDirectory(std::move(path)); }

  const std::string& path() const { return path_; }
  std::string deferFile() const { return path_ + "/defer"; }

  // Whether somebody holds the right to run. To find out takes it, shared, for an instant. A
  // process that wants to run in that instant waits until it is free again.
  bool isLocked() const;

  // The right to run. Absent if another holder has it.
  std::optional<RunLock> tryLock() const;
  // Waits for the right to run. Absent if the directory cannot be opened or locked.
  std::optional<RunLock> waitForLock() const;

  // When the last run began. Absent if there is no record or it cannot be understood.
  std::optional<Date> lastRun() const;
  // The files of the service that are there and are not used, each with the reason.
  std::vector<PlatformError> refusedFiles() const;
  // Records a run. The error is absent if that succeeded; replaceFileDurably() says which record
  // stands after an error. REQUIRES: the caller holds the lock.
  std::optional<PlatformError> recordRun(Date begin) const;

  // How long the machine has put off the run that is due. Zero if there is no record or it cannot
  // be understood.
  std::chrono::seconds putOff() const;
  std::optional<PlatformError> recordPutOff(std::chrono::seconds time) const;

 private:
  explicit StateDirectory(std::string path) : path_(std::move(path)) {}
  std::optional<RunLock> lock(int operation) const;
  std::string recordFile() const { return path_ + "/scheduler-last-run"; }
  std::string putOffFile() const { return path_ + "/scheduler-put-off"; }

  std::string path_;
};

// What the run marker needs of the file system. Stateless; any thread.
class LocalFiles final : public FileManager {
 public:
  FileExistence existence(const std::string& path) override;
  std::optional<PlatformError> createFile(const std::string& path) override;
  // Removes a file, or a directory with its content. Mounted file systems and directories nested
  // deeper than kMaxRemovalDepth stay, with the directories above them. The error names the first
  // item that could not be removed.
  RemovalResult remove(const std::string& path) override;

  // Each level holds a descriptor, and a process usually has 1024 of them.
  static constexpr int kMaxRemovalDepth = 128;
};

}  // namespace tessel
