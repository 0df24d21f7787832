// SpoolReader: the analytics spool, read beside the service.
//
// Reads while the service writes, and never writes itself. If the service replaces the spool, the
// next open() follows. One thread at a time.

#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <utility>

#include "statora/ForwarderState.h"
#include "statora/Sqlite.h"

namespace tessel::ctl {

// What a spool holds.
struct SpoolContents {
  int64_t rows = 0;
  std::optional<int64_t> oldest;  // microseconds since 1970; absent where it is empty
  std::optional<int64_t> newest;
  uint64_t bytes = 0;  // database and write-ahead log
  // Of the database, what new rows cannot have. Delivered rows and free pages give way to them, so
  // these do not count.
  uint64_t bytesOfWaiting = 0;
  std::optional<uint64_t> limit;  // the service's TESSEL_SPOOL_LIMIT; absent until a run has sent
  int64_t delivered = 0;          // rows that a collector took and that are still here
  std::optional<ForwarderCounters> forwarder;  // absent where none ever worked on it
};

class SpoolReader {
 public:
  enum class State { open, absent, noAccess, damaged };

  explicit SpoolReader(const std::string& stateDirectory);

  const std::string& path() const { return path_; }
  // Opens the spool. If another file stands in its place by now, opens that one, and readNew()
  // begins with its first row.
  State open();
  // Why it is not open, in words.
  const std::string& reason() const { return reason_; }

  // Whether the service will set the spool aside, because what it holds is damaged.
  bool damaged() const;
  // Whether another program holds the spool locked. That ends by itself.
  bool locked() const;

  // Calls `visit` with each row behind those of earlier calls, oldest first. `visit` may take as
  // long as it likes: the spool is read page by page and not held meanwhile. False, with a reason,
  // where the spool cannot be read.
  bool readNew(const std::function<void(const SpooledEvent&)>& visit);
  // The row with this id. Absent if there is none, and if the spool cannot be read; then failed().
  std::optional<SpooledEvent> row(int64_t id);
  bool failed() const { return !failure_.ok(); }
  // The first and the last id in the spool; absent if it is empty.
  std::optional<std::pair<int64_t, int64_t>> ids();
  // Nothing, with a reason, where the spool cannot be read.
  std::optional<SpoolContents> contents();

 private:
  State openDatabase();
  SqliteStatus openAs(SqliteDatabase::Mode mode);
  bool sameFile() const;

  const std::string path_;
  SqliteDatabase database_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
  int64_t lastId_ = 0;
  SqliteStatus failure_;
  std::string reason_;
};

}  // namespace tessel::ctl
