// Files that outlive the process: the state directory, and what the run marker asks of a file
// system.

#pragma once

#include <optional>
#include <string>
#include <utility>
#include <variant>

#include "os/UniqueFd.h"
#include "platform/System.h"

namespace tessel {

// StateDirectory: the directory for what outlives the process, and the scheduler's files in it.
//
//   scheduler-last-run  when the last run began: microseconds since 1970 in decimal and a line
//                       feed; replaced as a whole, by the holder of the lock only
//   defer               made and removed by others: while anything is there, runs are deferred
//
// The process that has a run holds the directory itself with flock(), for as long as it has it. One
// that cannot be written to serves all the same: a run then loses its record and its events, and
// says so.
//
// Immutable once opened; any thread may use it.

// Holds the right to run until it is destroyed or the process ends.
class RunLock {
 public:
  explicit RunLock(UniqueFd directory) : directory_(std::move(directory)) {}

 private:
  UniqueFd directory_;  // closing it releases the lock
};

class StateDirectory {
 public:
  // Makes the directory (mode 0750) where it is missing. The error is one line that names the
  // directory and what is wrong with it: it cannot be made, is none, or cannot be read.
  static std::variant<StateDirectory, std::string> open(const std::string& path);
  // The directory for those who only look: neither it nor anything in it is made.
  static StateDirectory forReading(std::string path) { return StateDirectory(std::move(path)); }

  const std::string& path() const { return path_; }
  std::string deferFile() const { return path_ + "/defer"; }

  // The right to run; nothing where another holder has it.
  std::optional<RunLock> tryLock() const;
  // Waits for the right to run. Nothing where the directory cannot be opened or locked.
  std::optional<RunLock> waitForLock() const;

  // When the last run began; nothing where none is recorded or the record cannot be understood.
  std::optional<Date> lastRun() const;
  // Records a run. The reason in words where that fails; an earlier record then still stands.
  // REQUIRES: the caller holds the lock.
  std::optional<std::string> recordRun(Date begin) const;

 private:
  explicit StateDirectory(std::string path) : path_(std::move(path)) {}
  std::optional<RunLock> lock(int operation) const;
  std::string recordFile() const { return path_ + "/scheduler-last-run"; }

  std::string path_;
};

// LocalFiles: the marker file's few needs of the file system. Stateless; any thread.

class LocalFiles final : public FileManager {
 public:
  FileExistence existence(const std::string& path) override;
  bool createFile(const std::string& path) override;
  // A directory goes with all that is in it, but what is mounted below it stays, and so do the
  // directories above that; neither does more than kMaxRemovalDepth directories in one another. The
  // error names the first item that could not be removed.
  RemovalResult remove(const std::string& path) override;

  // A directory in this many others is not looked into: each level holds a descriptor.
  static constexpr int kMaxRemovalDepth = 128;
};

}  // namespace tessel
