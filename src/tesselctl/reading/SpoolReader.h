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
#include <vector>

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
  std::optional<uint64_t>
      limit;              // the service's TESSEL_SPOOL_LIMIT; absent until a run has reported
  int64_t delivered = 0;  // rows that a collector took and that are still here
  int64_t setAside = 0;   // rows that a collector refused
  std::optional<ForwarderCounters> forwarder;  // absent where none ever worked on it
};

// A row of the spool. Its id is 0 for a record that the forwarder itself has made.
struct SpoolRow {
  struct Delivery {
    int64_t at = 0;  // microseconds since 1970
    std::string destination;
  };

  SpooledEvent event;
  std::optional<Delivery> delivery;  // absent while the row waits
};

// The rows that one destination has taken.
struct Delivered {
  std::string destination;
  int64_t rows = 0;
  int64_t last = 0;  // when it took the last one, in microseconds since 1970
};

enum class SpoolRows { all, waiting, delivered };

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

  // Calls `visit` with each row behind those of earlier calls: what was delivered, in the order of
  // delivery, and then what waits, oldest first. A row that was visited while it waited is not
  // visited again when it is delivered, unless the delivered ones alone are wanted. `visit` may
  // take as long as it likes: the spool is read page by page and not held meanwhile. False, with a
  // reason, where the spool cannot be read.
  bool readNew(SpoolRows wanted, const std::function<void(const SpoolRow&)>& visit);
  // The row with this id. Absent if there is none, and if the spool cannot be read; then failed().
  std::optional<SpoolRow> row(int64_t id);
  bool failed() const { return !failure_.ok(); }
  // The first and the last id in the spool; absent if it is empty.
  std::optional<std::pair<int64_t, int64_t>> ids();
  // Nothing, with a reason, where the spool cannot be read.
  std::optional<SpoolContents> contents();
  // The destinations of the delivered rows, the one that took a row last first; at most eight.
  std::vector<Delivered> deliveries();

 private:
  State openDatabase();
  SqliteStatus openAs(SqliteDatabase::Mode mode);
  bool sameFile() const;
  std::optional<std::vector<SpoolRow>> nextPage(SpoolRows wanted);
  std::vector<DeliveredEvent> deliveredRows(const std::string& select, int64_t bound, size_t rows);

  const std::string path_;
  SqliteDatabase database_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
  int64_t lastId_ = 0;      // of the rows that were visited while they waited
  int64_t lastNumber_ = 0;  // of those that were visited as delivered
  SqliteStatus failure_;
  std::string reason_;
};

}  // namespace tessel::ctl
